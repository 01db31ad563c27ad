/* nss-buffer.h - packs name-service results into the buffer the caller hands in */
#ifndef KEST_NSS_BUFFER_H
#define KEST_NSS_BUFFER_H

#include <nss.h>
#include <stddef.h>

/* Copies fail softly: a failed one returns NULL and is remembered, so that a whole entry is packed
 * first and judged once by nss_buffer_status. */
struct nss_buffer {
    char *next;
    size_t left;
    int too_small;
    int invalid;
};

void nss_buffer_init(struct nss_buffer *buffer, char *memory, size_t size);
/* length bytes of text, NUL-terminated. */
char *nss_buffer_copy(struct nss_buffer *buffer, const char *text, size_t length);
/* The JSON string value at value, decoded. */
char *nss_buffer_json(struct nss_buffer *buffer, const char *value);
/* An array of count pointers, aligned for them. */
char **nss_buffer_pointers(struct nss_buffer *buffer, size_t count);
/* Records a value of the wrong form. */
void nss_buffer_reject(struct nss_buffer *buffer);

/* NSS_STATUS_SUCCESS; NSS_STATUS_TRYAGAIN with ERANGE when the buffer was too small, so that glibc
 * retries with a larger one; NSS_STATUS_UNAVAIL with ENOENT for a value of the wrong form. */
enum nss_status nss_buffer_status(const struct nss_buffer *buffer, int *errnop);

/* NSS_STATUS_NOTFOUND and NSS_STATUS_UNAVAIL, each with ENOENT. */
enum nss_status nss_not_found(int *errnop);
enum nss_status nss_unavailable(int *errnop);

#endif
