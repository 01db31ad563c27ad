/* paths.c - resolution of the fixed paths under the optional test root */
#define _GNU_SOURCE
#include "paths.h"

#include <stdio.h>
#include <stdlib.h>

const char *kest_root(void)
{
    /* secure_getenv: a set-user-id module caller must never be redirected by its user. */
    const char *root = secure_getenv(KEST_ROOT_ENV);
    return root ? root : "";
}

int kest_path(const char *path, char *out, size_t size)
{
    if (out == NULL || size == 0)
        return 0;
    int written = snprintf(out, size, "%s%s", kest_root(), path ? path : "");
    if (written < 0 || (size_t)written >= size) {
        out[0] = '\0';
        return 0;
    }
    return 1;
}
