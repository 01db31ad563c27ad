/* cache-common.h - direct loader of a name-service module and its function table */
#ifndef KEST_CACHE_COMMON_H
#define KEST_CACHE_COMMON_H

#ifdef __cplusplus
extern "C" {
#endif

enum nss_function_index {
    NSS_GETPWNAM_R,
    NSS_GETPWUID_R,
    NSS_SETPWENT,
    NSS_ENDPWENT,
    NSS_GETPWENT_R,
    NSS_GETGRNAM_R,
    NSS_GETGRGID_R,
    NSS_SETGRENT,
    NSS_ENDGRENT,
    NSS_GETGRENT_R,
    NSS_INITGROUPS_DYN,
    NSS_GETSPNAM_R,
    NSS_SETSPENT,
    NSS_ENDSPENT,
    NSS_GETSPENT_R,
    NSS_GETSGNAM_R,
    NSS_SETSGENT,
    NSS_ENDSGENT,
    NSS_GETSGENT_R,
    NSS_FUNCTION_COUNT
};

#define NSS_SYMBOL_NAME_SIZE 64

struct nss_function_entry {
    void *function; /* null when the module lacks the symbol */
    const char *pattern;
    char name[NSS_SYMBOL_NAME_SIZE];
};

/* The process-wide table and handle, filled by the account list code. */
extern struct nss_function_entry nss_function_table[NSS_FUNCTION_COUNT];
extern void *nss_library_handle;

/* Opens libnss_<service>.so<suffix> of the multi-arch library directory and fills table; null on failure. */
void *load_nss_library(const char *service, const char *suffix, struct nss_function_entry *table);

#ifdef __cplusplus
}
#endif

#endif
