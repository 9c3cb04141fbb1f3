/*
 * key_list.cpp - the keyed list behind the TLV box.
 */
#include "key_list.h"

#include "ta_heap.h"
#include "ta_log.h"

key_list *key_list_create(key_list_release_fn release) {
    auto *list = ta_new<key_list>();
    if (!list)
        return nullptr;
    list->count = 0;
    list->head = nullptr;
    list->release = release;
    return list;
}

void key_list_destroy(key_list *list) {
    if (!list)
        return;
    key_list_node_t *node = list->head;
    while (node) {
        key_list_node_t *next = node->next;
        if (list->release)
            list->release(node->value);
        ta_free(node);
        node = next;
    }
    ta_free(list);
}

int key_list_add(key_list *list, int32_t key, void *value) {
    if (!list || key_list_find(list, key))
        return -1;
    auto *node = ta_new<key_list_node_t>();
    if (!node)
        return -1;
    node->key = key;
    node->value = value;
    node->prev = nullptr;
    node->next = list->head;
    if (list->head)
        list->head->prev = node;
    list->head = node;
    ++list->count;
    return 0;
}

key_list_node_t *key_list_find(const key_list *list, int32_t key) {
    if (!list)
        return nullptr;
    for (key_list_node_t *node = list->head; node; node = node->next)
        if (node->key == key)
            return node;
    return nullptr;
}

int key_list_contains(const key_list *list, int32_t key) {
    return key_list_find(list, key) ? 1 : 0;
}

int key_list_get(const key_list *list, int32_t key, void **value) {
    key_list_node_t *node = key_list_find(list, key);
    if (!node)
        return -1;
    *value = node->value;
    return 0;
}

int key_list_replace(key_list *list, int32_t key, void *value) {
    key_list_node_t *node = key_list_find(list, key);
    if (!node)
        return -1;
    node->value = value;
    return 0;
}

int key_list_remove(key_list *list, int32_t key) {
    key_list_node_t *node = key_list_find(list, key);
    if (!node)
        return -1;
    if (node->prev)
        node->prev->next = node->next;
    else
        list->head = node->next;
    if (node->next)
        node->next->prev = node->prev;
    if (list->release)
        list->release(node->value);
    ta_free(node);
    --list->count;
    return 0;
}
