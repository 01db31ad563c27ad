/* nss-passwd.c - the passwd map of the name-service module: network accounts as cache-kest knows them */
#include "common.h"
#include "daemon-client.h"
#include "json-reader.h"
#include "map-file.h"
#include "nss-buffer.h"
#include "nss-listing.h"

#include <errno.h>
#include <limits.h>
#include <nss.h>
#include <pthread.h>
#include <pwd.h>
#include <signal.h>
#include <stdatomic.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <time.h>

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

/* The daemon's entry for key, as read_function answers it. */
static enum nss_status read_entry(unsigned short port, const char *read_function, const char *key, struct passwd *pwd,
    char *buffer, size_t buflen, int *errnop)
{
    char *reply = NULL;
    if (!kest_call(port, read_function, &key, 1, &reply))
        return nss_unavailable(errnop);
    enum nss_status status = kest_reply_passed(reply)
        ? fill_passwd(json_member(reply, "user"), pwd, buffer, buflen, errnop)
        : nss_not_found(errnop);
    free(reply);
    return status;
}

/* One look-up, whichever way it is answered. */
struct passwd_query {
    const char *read_function;
    const char *query_function;
    const char *key;
    const char *name;
    uid_t uid;
    struct passwd *pwd;
    char *buffer;
    size_t buflen;
    int *errnop;
    enum nss_status status;
    uint32_t denied_by; /* the daemon whose negative answer the map holds for key, or 0 */
};

/* Lets the daemon ask the domain server; 1 when the account exists. */
static int ask(unsigned short port, const struct passwd_query *query)
{
    char *reply = NULL;
    int known = kest_call(port, query->query_function, &query->key, 1, &reply) && kest_reply_passed(reply);
    free(reply);
    return known;
}

/* Without a map: the cached entry; only when there is none, one query that lets the daemon ask the domain
 * server, then a second read of the entry. */
static enum nss_status ask_daemon(struct passwd_query *query)
{
    char *reply = NULL;
    const unsigned short port = kest_daemon_port();
    if (!kest_call(port, query->read_function, &query->key, 1, &reply))
        return nss_unavailable(query->errnop);
    enum nss_status status = NSS_STATUS_NOTFOUND;
    if (kest_reply_passed(reply))
        status = fill_passwd(json_member(reply, "user"), query->pwd, query->buffer, query->buflen, query->errnop);
    free(reply);
    if (status != NSS_STATUS_NOTFOUND)
        return status;
    if (!ask(port, query))
        return nss_not_found(query->errnop);
    return read_entry(port, query->read_function, query->key, query->pwd, query->buffer, query->buflen, query->errnop);
}

static enum kest_map_result copy_account(
    const struct kest_map_view *view, const struct kest_map_account *account, struct passwd_query *query)
{
    const char *name = kest_map_text(view, account->name), *gecos = kest_map_text(view, account->gecos),
               *home = kest_map_text(view, account->home), *shell = kest_map_text(view, account->shell);
    if (name == NULL || gecos == NULL || home == NULL || shell == NULL || account->uid < FIRST_DOMAIN_UID)
        return KEST_MAP_BROKEN;
    struct nss_buffer out;
    nss_buffer_init(&out, query->buffer, query->buflen);
    query->pwd->pw_uid = account->uid;
    query->pwd->pw_gid = account->gid;
    query->pwd->pw_name = nss_buffer_copy(&out, name, account->name.length);
    query->pwd->pw_passwd = nss_buffer_copy(&out, "x", 1);
    query->pwd->pw_gecos = nss_buffer_copy(&out, gecos, account->gecos.length);
    query->pwd->pw_dir = nss_buffer_copy(&out, home, account->home.length);
    query->pwd->pw_shell = nss_buffer_copy(&out, shell, account->shell.length);
    query->status = nss_buffer_status(&out, query->errnop);
    return KEST_MAP_FOUND;
}

/* An account the map lacks may be one the daemon already knows the domain server does not have. */
static enum kest_map_result note_negative(
    const struct kest_map_view *view, enum kest_map_result negative, struct passwd_query *query)
{
    if (negative == KEST_MAP_FOUND)
        query->denied_by = view->header.daemon_pid;
    return negative == KEST_MAP_BROKEN ? KEST_MAP_BROKEN : KEST_MAP_MISSING;
}

static enum kest_map_result account_of_name(const struct kest_map_view *view, void *context)
{
    struct passwd_query *query = context;
    struct kest_map_account account;
    enum kest_map_result result = kest_map_account_by_name(view, query->name, &account);
    if (result == KEST_MAP_MISSING)
        return note_negative(view, kest_map_negative_name(view, query->name, (int64_t)time(NULL)), query);
    return result == KEST_MAP_FOUND ? copy_account(view, &account, query) : result;
}

static enum kest_map_result account_of_uid(const struct kest_map_view *view, void *context)
{
    struct passwd_query *query = context;
    struct kest_map_account account;
    enum kest_map_result result = kest_map_account_by_uid(view, (uint32_t)query->uid, &account);
    if (result == KEST_MAP_MISSING)
        return note_negative(view, kest_map_negative_uid(view, (uint32_t)query->uid, (int64_t)time(NULL)), query);
    return result == KEST_MAP_FOUND ? copy_account(view, &account, query) : result;
}

/* The daemon last found running and the second it was found in (pid << 32 | second): asking the kernel
 * costs about as much as the rest of the look-up, so it is asked once a second. */
static _Atomic uint64_t found_running;

/* A negative answer is the daemon's own: once it is gone, a name it lacks is "unavailable" as before. One
 * that stops withdraws its negative answers from the map first; one that dies shows within a second. */
static int daemon_runs(uint32_t pid)
{
    if (pid == 0 || pid > INT_MAX)
        return 0;
    const uint64_t mark = (uint64_t)pid << 32 | ((uint64_t)time(NULL) & UINT32_MAX);
    if (atomic_load_explicit(&found_running, memory_order_relaxed) == mark)
        return 1;
    const int saved = errno;
    const int runs = kill((pid_t)pid, 0) == 0 || errno == EPERM;
    errno = saved;
    if (runs)
        atomic_store_explicit(&found_running, mark, memory_order_relaxed);
    return runs;
}

/* From the daemon's map when it holds the account. One it lacks is one the daemon has not cached: the
 * daemon asks the domain server, and publishes what it learns before it answers. */
static enum nss_status look_up(kest_map_use from_map, struct passwd_query *query)
{
    enum kest_map_result mapped = kest_map_file_use(from_map, query);
    if (mapped == KEST_MAP_FOUND)
        return query->status;
    if (mapped == KEST_MAP_BROKEN)
        return ask_daemon(query);
    if (daemon_runs(query->denied_by))
        return nss_not_found(query->errnop);
    const unsigned short port = kest_daemon_port();
    if (port == 0)
        return nss_unavailable(query->errnop);
    if (!ask(port, query))
        return nss_not_found(query->errnop);
    if (kest_map_file_use(from_map, query) == KEST_MAP_FOUND)
        return query->status;
    return read_entry(port, query->read_function, query->key, query->pwd, query->buffer, query->buflen, query->errnop);
}

enum nss_status _nss_kest_getpwnam_r(const char *name, struct passwd *pwd, char *buffer, size_t buflen, int *errnop)
{
    /* Local accounts never pay for this module: no network name, no work at all. */
    if (name == NULL || name[0] != '@' || name[1] == '\0')
        return nss_not_found(errnop);
    struct passwd_query query = { "getAccountByName", "queryAccountName", name, name, 0, pwd, buffer, buflen, errnop,
        NSS_STATUS_NOTFOUND, 0 };
    return look_up(account_of_name, &query);
}

enum nss_status _nss_kest_getpwuid_r(uid_t uid, struct passwd *pwd, char *buffer, size_t buflen, int *errnop)
{
    if (uid < FIRST_DOMAIN_UID)
        return nss_not_found(errnop);
    char text[UID_TEXT_SIZE];
    snprintf(text, sizeof(text), "%u", (unsigned int)uid);
    struct passwd_query query
        = { "getAccountByUid", "queryUid", text, NULL, uid, pwd, buffer, buflen, errnop, NSS_STATUS_NOTFOUND, 0 };
    return look_up(account_of_uid, &query);
}

static struct nss_listing account_walk = NSS_LISTING_INIT;

/* Only the accounts daemon, which feeds the login screen's user list, enumerates network accounts:
 * every other walk of the user database stays local and never pulls the whole cache. */
static void take_accounts(struct nss_listing *listing)
{
    if (!is_accounts_daemon() || !kest_call(kest_daemon_port(), "listAccounts", NULL, 0, &listing->text))
        return;
    if (kest_reply_passed(listing->text))
        listing->next = json_first(json_member(listing->text, "users"));
}

enum nss_status _nss_kest_setpwent(int stayopen)
{
    (void)stayopen;
    return nss_listing_restart(&account_walk, take_accounts);
}

enum nss_status _nss_kest_getpwent_r(struct passwd *pwd, char *buffer, size_t buflen, int *errnop)
{
    nss_listing_lock(&account_walk, take_accounts);
    enum nss_status status = NSS_STATUS_NOTFOUND;
    while (account_walk.next != NULL && status == NSS_STATUS_NOTFOUND) {
        status = fill_passwd(account_walk.next, pwd, buffer, buflen, errnop);
        /* A short buffer keeps the entry for glibc's retry; a malformed one is passed over. */
        if (status == NSS_STATUS_TRYAGAIN)
            break;
        account_walk.next = json_next(account_walk.next);
        if (status == NSS_STATUS_UNAVAIL)
            status = NSS_STATUS_NOTFOUND;
    }
    pthread_mutex_unlock(&account_walk.lock);
    return status == NSS_STATUS_NOTFOUND ? nss_not_found(errnop) : status;
}

enum nss_status _nss_kest_endpwent(void)
{
    return nss_listing_end(&account_walk);
}
