/* json-reader.h - reads values out of a JSON text in place, without allocating */
#ifndef KEST_JSON_READER_H
#define KEST_JSON_READER_H

#include <stddef.h>

/* Every function takes a pointer into a NUL-terminated text at the start of a value (white space may
 * come first) and accepts NULL there, so that look-ups can be chained; none reads past the NUL. */

/* The value of key in the object, or NULL when the object lacks it or is not one. */
const char *json_member(const char *object, const char *key);
/* The first element of the array, or NULL when it is empty or not an array. */
const char *json_first(const char *array);
/* The element after this one in its array, or NULL at the end. */
const char *json_next(const char *element);

/* 1 and the value for true or false; 0 for anything else. */
int json_bool(const char *value, int *out);
/* 1 and the value for an integer without fraction or exponent; 0 for anything else. */
int json_integer(const char *value, long long *out);
/* Decodes a string into out as UTF-8 and returns its length in bytes; out is written, NUL-terminated,
 * only when the length is smaller than size (so a length >= size asks for more room). -1 when the
 * value is not a string, or holds a bad escape or a NUL character. */
long json_string(const char *value, char *out, size_t size);

#endif
