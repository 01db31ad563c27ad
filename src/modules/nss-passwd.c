/* nss-passwd.c - the passwd map of the name-service module: network accounts as cache-kest knows them */
#include "common.h"
#include "daemon-client.h"
#include "json-reader.h"
#include "nss-buffer.h"

#include <errno.h>
#include <nss.h>
#include <pthread.h>
#include <pwd.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>

#define SOURCE_PATH "src/modules/nss-passwd"
#define FIRST_DOMAIN_UID 10000
#define UID_TEXT_SIZE 16

enum nss_status _nss_kest_getpwnam_r(const char *name, struct passwd *pwd, char *buffer, size_t buflen, int *errnop);
enum nss_status _nss_kest_getpwuid_r(uid_t uid, struct passwd *pwd, char *buffer, size_t buflen, int *errnop);
enum nss_status _nss_kest_setpwent(int stayopen);
enum nss_status _nss_kest_getpwent_r(struct passwd *pwd, char *buffer, size_t buflen, int *errnop);
enum nss_status _nss_kest_endpwent(void);

static int read_id(const char *value, uid_t *out)
{
    long long number;
    if (!json_integer(value, &number) || number < FIRST_DOMAIN_UID || number > UINT32_MAX)
        return 0;
    *out = (uid_t)number;
    return 1;
}

/* One account entry {"name","uid","gid","gecos","home","shell"} of the daemon's replies. */
static enum nss_status fill_passwd(const char *user, struct passwd *pwd, char *buffer, size_t buflen, int *errnop)
{
    struct nss_buffer out;
    nss_buffer_init(&out, buffer, buflen);
    long long gid = 0;
    if (!read_id(json_member(user, "uid"), &pwd->pw_uid) || !json_integer(json_member(user, "gid"), &gid) || gid < 0
        || gid > UINT32_MAX)
        nss_buffer_reject(&out);
    pwd->pw_gid = (gid_t)gid;
    pwd->pw_name = nss_buffer_json(&out, json_member(user, "name"));
    pwd->pw_passwd = nss_buffer_copy(&out, "x", 1);
    pwd->pw_gecos = nss_buffer_json(&out, json_member(user, "gecos"));
    pwd->pw_dir = nss_buffer_json(&out, json_member(user, "home"));
    pwd->pw_shell = nss_buffer_json(&out, json_member(user, "shell"));
    enum nss_status status = nss_buffer_status(&out, errnop);
    if (status == NSS_STATUS_UNAVAIL)
        log_message(3, SOURCE_PATH, __LINE__, __func__, "cache-kest sent an account entry of the wrong form");
    return status;
}

static enum nss_status unavailable(int *errnop)
{
    *errnop = ENOENT;
    return NSS_STATUS_UNAVAIL;
}

static enum nss_status not_found(int *errnop)
{
    *errnop = ENOENT;
    return NSS_STATUS_NOTFOUND;
}

/* The cached entry; only when there is none, one query that lets the daemon ask the domain server,
 * then a second read of the entry. */
static enum nss_status look_up(const char *read_function, const char *query_function, const char *key,
    struct passwd *pwd, char *buffer, size_t buflen, int *errnop)
{
    char *reply = NULL;
    if (!kest_call(read_function, &key, 1, &reply))
        return unavailable(errnop);
    if (!kest_reply_passed(reply)) {
        free(reply);
        int known = kest_call(query_function, &key, 1, &reply) && kest_reply_passed(reply);
        free(reply);
        if (!known)
            return not_found(errnop);
        if (!kest_call(read_function, &key, 1, &reply))
            return unavailable(errnop);
    }
    enum nss_status status = kest_reply_passed(reply)
        ? fill_passwd(json_member(reply, "user"), pwd, buffer, buflen, errnop)
        : not_found(errnop);
    free(reply);
    return status;
}

enum nss_status _nss_kest_getpwnam_r(const char *name, struct passwd *pwd, char *buffer, size_t buflen, int *errnop)
{
    /* Local accounts never pay for this module: no network name, no work at all. */
    if (name == NULL || name[0] != '@' || name[1] == '\0')
        return not_found(errnop);
    return look_up("getAccountByName", "queryAccountName", name, pwd, buffer, buflen, errnop);
}

enum nss_status _nss_kest_getpwuid_r(uid_t uid, struct passwd *pwd, char *buffer, size_t buflen, int *errnop)
{
    if (uid < FIRST_DOMAIN_UID)
        return not_found(errnop);
    char text[UID_TEXT_SIZE];
    snprintf(text, sizeof(text), "%u", (unsigned int)uid);
    return look_up("getAccountByUid", "queryUid", text, pwd, buffer, buflen, errnop);
}

/* Enumeration: glibc serialises it per process already; the lock keeps the list sound for any
 * other caller of these symbols. */
static pthread_mutex_t listing_lock = PTHREAD_MUTEX_INITIALIZER;
static char *listing;
static const char *next_entry;
static int listing_taken;

static void drop_listing(void)
{
    free(listing);
    listing = NULL;
    next_entry = NULL;
    listing_taken = 0;
}

/* Only the accounts daemon, which feeds the login screen's user list, enumerates network accounts:
 * every other walk of the user database stays local and never pulls the whole cache. */
static void take_listing(void)
{
    listing_taken = 1;
    if (!is_accounts_daemon() || !kest_call("listAccounts", NULL, 0, &listing))
        return;
    if (kest_reply_passed(listing))
        next_entry = json_first(json_member(listing, "users"));
}

enum nss_status _nss_kest_setpwent(int stayopen)
{
    (void)stayopen;
    pthread_mutex_lock(&listing_lock);
    drop_listing();
    take_listing();
    pthread_mutex_unlock(&listing_lock);
    return NSS_STATUS_SUCCESS;
}

enum nss_status _nss_kest_getpwent_r(struct passwd *pwd, char *buffer, size_t buflen, int *errnop)
{
    pthread_mutex_lock(&listing_lock);
    if (!listing_taken)
        take_listing();
    enum nss_status status = NSS_STATUS_NOTFOUND;
    while (next_entry != NULL && status == NSS_STATUS_NOTFOUND) {
        status = fill_passwd(next_entry, pwd, buffer, buflen, errnop);
        /* A short buffer keeps the entry for glibc's retry; a malformed one is passed over. */
        if (status == NSS_STATUS_TRYAGAIN)
            break;
        next_entry = json_next(next_entry);
        if (status == NSS_STATUS_UNAVAIL)
            status = NSS_STATUS_NOTFOUND;
    }
    pthread_mutex_unlock(&listing_lock);
    return status == NSS_STATUS_NOTFOUND ? not_found(errnop) : status;
}

enum nss_status _nss_kest_endpwent(void)
{
    pthread_mutex_lock(&listing_lock);
    drop_listing();
    pthread_mutex_unlock(&listing_lock);
    return NSS_STATUS_SUCCESS;
}
