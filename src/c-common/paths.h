/* paths.h - the system's fixed file paths and the test-root prefix in front of them */
#ifndef KEST_PATHS_H
#define KEST_PATHS_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

#define KEST_PATH_SETTINGS "/etc/kest-iam.conf"
#define KEST_PATH_WORKDIR "/var/lib/libkest-iam"
#define KEST_PATH_DBUS_PID "/run/dbus-kest.pid"
#define KEST_PATH_CACHE_PID "/run/cache-kest.pid"
#define KEST_PATH_HOME "/home"
#define KEST_PATH_MACHINE_ID "/usr/share/kest/machine.txt"
/* The accounts cache-kest publishes for the name-service module (account-map-format.h). */
#define KEST_PATH_ACCOUNT_MAP "/run/cache-kest.map"

/* Environment variable naming a directory put in front of the paths above (tests only). */
#define KEST_ROOT_ENV "KEST_IAM_ROOT"

/* The prefix from KEST_IAM_ROOT, or "" when unset or for set-user-id programs. */
const char *kest_root(void);

/* Writes root + path into out; returns 1, or 0 when it does not fit (out is then empty). */
int kest_path(const char *path, char *out, size_t size);

#ifdef __cplusplus
}
#endif

#endif
