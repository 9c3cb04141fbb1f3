/*
 * key_list.h - a small doubly linked list of values keyed by a 32-bit
 * integer, newest first. The list owns its values through the release
 * function given at creation.
 */
#ifndef KEY_LIST_H
#define KEY_LIST_H

#include <cstdint>

using key_list_release_fn = void (*)(void *value);

struct key_list_node_t {
    int32_t key;
    void *value;
    key_list_node_t *prev;
    key_list_node_t *next;
};

struct key_list {
    uint32_t count;
    key_list_node_t *head; // the most recently added node
    key_list_release_fn release;
};

/* key_list_create - a new empty list, or null (logged) when memory is short. */
key_list *key_list_create(key_list_release_fn release);

/* key_list_destroy - releases every value from the head on, frees the nodes and the list; null is ignored. */
void key_list_destroy(key_list *list);

/*
 * key_list_add - links a new node for (key, value) in front of the head.
 * 0 on success, when the list owns the value; -1 when the key is present or
 * memory is short, and the caller keeps the value.
 */
int key_list_add(key_list *list, int32_t key, void *value);

/* key_list_find - the first node from the head with this key, or null. */
key_list_node_t *key_list_find(const key_list *list, int32_t key);

/* key_list_contains - 1 when the key is present, else 0. */
int key_list_contains(const key_list *list, int32_t key);

/* key_list_get - 0 and *value when present, else -1. */
int key_list_get(const key_list *list, int32_t key, void **value);

/* key_list_replace - sets the node's value without releasing the old one (the caller keeps it); -1 if absent. */
int key_list_replace(key_list *list, int32_t key, void *value);

/* key_list_remove - unlinks the node, releases its value, frees it; 0, or -1 if absent. */
int key_list_remove(key_list *list, int32_t key);

#endif
