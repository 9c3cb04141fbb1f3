/*
 * json_writer.h - the compact JSON writer of the SOTER documents. A
 * document is one flat object whose members are strings or numbers, kept
 * in the order their names were first set. Signatures cover the rendered
 * bytes, so the rendering rules are part of the TA's interface:
 *
 * - no whitespace between tokens;
 * - strings escape '"', '\\', '/', and BS, FF, LF, CR, TAB as \b \f \n \r \t;
 *   every other byte (other control bytes, UTF-8 sequences) is copied as it
 *   stands, never as \u;
 * - a number equal to an integer renders as that integer in decimal
 *   ("%lld"; integers beyond 64 bits exactly as well), any other finite
 *   number as "%f" (six decimals, correctly rounded).
 *
 * Nothing recurses: the document is flat and rendered by iteration.
 */
#ifndef JSON_WRITER_H
#define JSON_WRITER_H

#include <cstdint>

struct json_member_t;

struct json_doc {
    json_member_t *members;
    uint32_t count;
    uint32_t capacity;
};

/* The most members one document holds. */
constexpr uint32_t kJsonMaxMembers = 960;

/* json_doc_create - a new empty document, or null when memory is short. The caller frees it with json_doc_free. */
json_doc *json_doc_create();

/*
 * json_doc_set_string - sets member name to a copy of value. 0 on success;
 * -1, with the document unchanged, when an argument is missing, the name or
 * value is not well-formed UTF-8, the document is full or memory is short.
 */
int json_doc_set_string(json_doc *doc, const char *name, const char *value);

/* json_doc_set_number - the same for a number; -1 also for an infinite or NaN value. */
int json_doc_set_number(json_doc *doc, const char *name, double value);

/* json_doc_render - a new NUL-terminated compact rendering, or null; the caller frees it with json_doc_free_text. */
char *json_doc_render(const json_doc *doc);

/* json_doc_free_text - frees a rendering; null is ignored. */
void json_doc_free_text(char *text);

/* json_doc_free - frees the document with every member name and value; null is ignored. */
void json_doc_free(json_doc *doc);

/*
 * utf8_is_valid - 1 when the length bytes of buf are well-formed UTF-8
 * (no overlong forms, no surrogates, nothing above U+10FFFF, no truncated
 * sequence), else 0. A NUL byte is a valid one-byte sequence here.
 */
int utf8_is_valid(const uint8_t *buf, uint32_t length);

#endif
