/* cache-common.c - direct loader of a name-service module and its function table */
#define _GNU_SOURCE
#include "cache-common.h"

#include "common.h"

#include <dlfcn.h>
#include <stdio.h>
#include <string.h>

#ifndef KEST_NSS_LIBDIR
#error "KEST_NSS_LIBDIR must name the multi-arch library directory"
#endif

#define PATH_BUFFER_SIZE 32767

static const char *const patterns[NSS_FUNCTION_COUNT] = {
    "_nss_%s_getpwnam_r", "_nss_%s_getpwuid_r", "_nss_%s_setpwent",     "_nss_%s_endpwent",   "_nss_%s_getpwent_r",
    "_nss_%s_getgrnam_r", "_nss_%s_getgrgid_r", "_nss_%s_setgrent",     "_nss_%s_endgrent",   "_nss_%s_getgrent_r",
    "_nss_%s_initgroups_dyn", "_nss_%s_getspnam_r", "_nss_%s_setspent", "_nss_%s_endspent",   "_nss_%s_getspent_r",
    "_nss_%s_getsgnam_r", "_nss_%s_setsgent",   "_nss_%s_endsgent",     "_nss_%s_getsgent_r",
};

struct nss_function_entry nss_function_table[NSS_FUNCTION_COUNT];
void *nss_library_handle = NULL;

static void *open_module(const char *service, const char *suffix)
{
    char path[PATH_BUFFER_SIZE];
    memset(path, 0, sizeof(path));
    snprintf(path, sizeof(path) - 1, "%slibnss_%s.so%s", KEST_NSS_LIBDIR, service, suffix ? suffix : "");
    return dlopen(path, RTLD_LAZY);
}

void *load_nss_library(const char *service, const char *suffix, struct nss_function_entry *table)
{
    dlerror();
    if (service == NULL || table == NULL)
        return NULL;

    int default_suffix = suffix == NULL || suffix[0] == '\0';
    void *handle = open_module(service, default_suffix ? NULL : suffix);
    /* Current glibc ships the module only under its versioned name. */
    if (handle == NULL && default_suffix)
        handle = open_module(service, ".2");
    if (handle == NULL) {
        log_message(3, "src/c-common/cache-common", 38, "load_nss_library",
                    "critical error! cound not find libnss_files.so.");
        return NULL;
    }

    for (int i = 0; i < NSS_FUNCTION_COUNT; ++i) {
        table[i].pattern = patterns[i];
        memset(table[i].name, 0, NSS_SYMBOL_NAME_SIZE);
        snprintf(table[i].name, NSS_SYMBOL_NAME_SIZE, patterns[i], service);
        table[i].function = dlsym(handle, table[i].name);
    }
    return handle;
}
