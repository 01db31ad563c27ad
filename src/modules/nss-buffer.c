/* nss-buffer.c - packs name-service results into the buffer the caller hands in */
#include "nss-buffer.h"

#include "json-reader.h"

#include <errno.h>
#include <stdalign.h>
#include <stdint.h>
#include <string.h>

void nss_buffer_init(struct nss_buffer *buffer, char *memory, size_t size)
{
    buffer->next = memory;
    buffer->left = memory != NULL ? size : 0;
    buffer->too_small = 0;
    buffer->invalid = 0;
}

static char *short_of_room(struct nss_buffer *buffer)
{
    buffer->too_small = 1;
    return NULL;
}

static char *take(struct nss_buffer *buffer, size_t size)
{
    if (buffer->too_small || buffer->invalid)
        return NULL;
    if (size > buffer->left)
        return short_of_room(buffer);
    char *start = buffer->next;
    buffer->next += size;
    buffer->left -= size;
    return start;
}

char *nss_buffer_copy(struct nss_buffer *buffer, const char *text, size_t length)
{
    char *copy = take(buffer, length + 1);
    if (copy == NULL)
        return NULL;
    memcpy(copy, text, length);
    copy[length] = '\0';
    return copy;
}

char *nss_buffer_json(struct nss_buffer *buffer, const char *value)
{
    if (buffer->too_small || buffer->invalid)
        return NULL;
    long length = json_string(value, buffer->next, buffer->left);
    if (length < 0) {
        buffer->invalid = 1;
        return NULL;
    }
    /* Decoded in place already when it fits; take() only books the room or marks it too small. */
    return take(buffer, (size_t)length + 1);
}

char **nss_buffer_pointers(struct nss_buffer *buffer, size_t count)
{
    size_t misalignment = (uintptr_t)buffer->next % alignof(char *);
    size_t padding = misalignment ? alignof(char *) - misalignment : 0;
    if (padding > buffer->left || count > (buffer->left - padding) / sizeof(char *))
        return (char **)short_of_room(buffer);
    char *start = take(buffer, padding + count * sizeof(char *));
    return start != NULL ? (char **)(void *)(start + padding) : NULL;
}

void nss_buffer_reject(struct nss_buffer *buffer)
{
    buffer->invalid = 1;
}

enum nss_status nss_buffer_status(const struct nss_buffer *buffer, int *errnop)
{
    if (buffer->invalid) {
        *errnop = ENOENT;
        return NSS_STATUS_UNAVAIL;
    }
    if (buffer->too_small) {
        *errnop = ERANGE;
        return NSS_STATUS_TRYAGAIN;
    }
    return NSS_STATUS_SUCCESS;
}

enum nss_status nss_not_found(int *errnop)
{
    *errnop = ENOENT;
    return NSS_STATUS_NOTFOUND;
}

enum nss_status nss_unavailable(int *errnop)
{
    *errnop = ENOENT;
    return NSS_STATUS_UNAVAIL;
}
