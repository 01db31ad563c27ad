/* json-reader.c - reads values out of a JSON text in place, without allocating */
#include "json-reader.h"

#include <string.h>

#define MAX_INTEGER_DIGITS 18

static const char *skip_space(const char *p)
{
    while (*p == ' ' || *p == '\t' || *p == '\n' || *p == '\r')
        ++p;
    return p;
}

static int is_scalar_character(char c)
{
    return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '-' || c == '+'
        || c == '.';
}

/* Past the string whose opening quote is at p, or NULL. */
static const char *skip_string(const char *p)
{
    for (++p; *p != '"'; ++p) {
        if ((unsigned char)*p < 0x20)
            return NULL;
        if (*p == '\\' && *++p == '\0')
            return NULL;
    }
    return p + 1;
}

/* Past the value at p, or NULL. Brackets are counted, not matched by kind: the text comes from the
 * daemon's JSON writer, and what matters here is never to run past its end. */
static const char *skip_value(const char *p)
{
    size_t depth = 0;
    do {
        p = skip_space(p);
        if (*p == '"') {
            p = skip_string(p);
            if (p == NULL)
                return NULL;
        } else if (*p == '{' || *p == '[') {
            ++depth;
            ++p;
        } else if ((*p == '}' || *p == ']' || *p == ',' || *p == ':') && depth > 0) {
            depth -= *p == '}' || *p == ']';
            ++p;
        } else if (is_scalar_character(*p)) {
            while (is_scalar_character(*p))
                ++p;
        } else {
            return NULL;
        }
    } while (depth > 0);
    return p;
}

static int key_is(const char *quoted, const char *end, const char *key)
{
    size_t length = strlen(key);
    return (size_t)(end - quoted) == length + 2 && memcmp(quoted + 1, key, length) == 0;
}

const char *json_member(const char *object, const char *key)
{
    if (object == NULL || key == NULL)
        return NULL;
    const char *p = skip_space(object);
    if (*p != '{')
        return NULL;
    p = skip_space(p + 1);
    while (*p == '"') {
        const char *name_end = skip_string(p);
        if (name_end == NULL)
            return NULL;
        const char *colon = skip_space(name_end);
        if (*colon != ':')
            return NULL;
        const char *value = skip_space(colon + 1);
        if (key_is(p, name_end, key))
            return value;
        const char *after = skip_value(value);
        if (after == NULL)
            return NULL;
        after = skip_space(after);
        if (*after != ',')
            return NULL;
        p = skip_space(after + 1);
    }
    return NULL;
}

const char *json_first(const char *array)
{
    if (array == NULL)
        return NULL;
    const char *p = skip_space(array);
    if (*p != '[')
        return NULL;
    p = skip_space(p + 1);
    return *p == ']' || *p == '\0' ? NULL : p;
}

const char *json_next(const char *element)
{
    const char *p = element ? skip_value(element) : NULL;
    if (p == NULL)
        return NULL;
    p = skip_space(p);
    return *p == ',' ? skip_space(p + 1) : NULL;
}

int json_bool(const char *value, int *out)
{
    if (value == NULL)
        return 0;
    const char *p = skip_space(value);
    const char *end = skip_value(p);
    if (end == NULL)
        return 0;
    if (end - p == 4 && memcmp(p, "true", 4) == 0)
        *out = 1;
    else if (end - p == 5 && memcmp(p, "false", 5) == 0)
        *out = 0;
    else
        return 0;
    return 1;
}

int json_integer(const char *value, long long *out)
{
    if (value == NULL)
        return 0;
    const char *p = skip_space(value);
    int negative = *p == '-';
    p += negative;
    long long number = 0;
    int digits = 0;
    for (; *p >= '0' && *p <= '9'; ++p) {
        if (++digits > MAX_INTEGER_DIGITS)
            return 0;
        number = number * 10 + (*p - '0');
    }
    if (digits == 0 || is_scalar_character(*p))
        return 0;
    *out = negative ? -number : number;
    return 1;
}

static int read_hex4(const char *p, unsigned long *out)
{
    unsigned long code = 0;
    for (int i = 0; i < 4; ++i) {
        char c = p[i];
        int digit = c >= '0' && c <= '9' ? c - '0'
            : c >= 'a' && c <= 'f'       ? c - 'a' + 10
            : c >= 'A' && c <= 'F'       ? c - 'A' + 10
                                         : -1;
        if (digit < 0)
            return 0;
        code = code * 16 + (unsigned long)digit;
    }
    *out = code;
    return 1;
}

static size_t encode_utf8(unsigned long code, char *bytes)
{
    if (code < 0x80) {
        bytes[0] = (char)code;
        return 1;
    }
    if (code < 0x800) {
        bytes[0] = (char)(0xc0 | (code >> 6));
        bytes[1] = (char)(0x80 | (code & 0x3f));
        return 2;
    }
    if (code < 0x10000) {
        bytes[0] = (char)(0xe0 | (code >> 12));
        bytes[1] = (char)(0x80 | ((code >> 6) & 0x3f));
        bytes[2] = (char)(0x80 | (code & 0x3f));
        return 3;
    }
    bytes[0] = (char)(0xf0 | (code >> 18));
    bytes[1] = (char)(0x80 | ((code >> 12) & 0x3f));
    bytes[2] = (char)(0x80 | ((code >> 6) & 0x3f));
    bytes[3] = (char)(0x80 | (code & 0x3f));
    return 4;
}

/* Decodes the \u escape whose "u" is at *p, surrogate pairs included; advances *p to its last digit. */
static size_t decode_unicode_escape(const char **p, char *bytes)
{
    unsigned long code;
    if (!read_hex4(*p + 1, &code))
        return 0;
    *p += 4;
    if (code >= 0xdc00 && code <= 0xdfff)
        return 0;
    if (code >= 0xd800 && code <= 0xdbff) {
        unsigned long low;
        if ((*p)[1] != '\\' || (*p)[2] != 'u' || !read_hex4(*p + 3, &low) || low < 0xdc00 || low > 0xdfff)
            return 0;
        code = 0x10000 + ((code - 0xd800) << 10) + (low - 0xdc00);
        *p += 6;
    }
    return code == 0 ? 0 : encode_utf8(code, bytes);
}

static size_t decode_escape(const char **p, char *bytes)
{
    static const char from[] = "\"\\/bfnrt";
    static const char to[] = "\"\\/\b\f\n\r\t";
    ++*p;
    if (**p == 'u')
        return decode_unicode_escape(p, bytes);
    const char *found = **p != '\0' ? strchr(from, **p) : NULL;
    if (found == NULL)
        return 0;
    bytes[0] = to[found - from];
    return 1;
}

long json_string(const char *value, char *out, size_t size)
{
    if (value == NULL)
        return -1;
    const char *p = skip_space(value);
    if (*p != '"')
        return -1;
    size_t length = 0;
    for (++p; *p != '"'; ++p) {
        char bytes[4];
        size_t count = 1;
        if ((unsigned char)*p < 0x20)
            return -1;
        if (*p == '\\')
            count = decode_escape(&p, bytes);
        else
            bytes[0] = *p;
        if (count == 0)
            return -1;
        if (length + count < size)
            memcpy(out + length, bytes, count);
        length += count;
    }
    if (length < size)
        out[length] = '\0';
    return (long)length;
}
