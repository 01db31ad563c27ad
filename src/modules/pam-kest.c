/* pam-kest.c - the login module: passwords, account state and password changes of network accounts */
#define _GNU_SOURCE
#include "common.h"
#include "daemon-client.h"
#include "json-reader.h"

#include <security/pam_ext.h>
#include <security/pam_modules.h>
#include <stdlib.h>
#include <string.h>
#include <syslog.h>

#define SOURCE_PATH "src/modules/pam-kest"
#define CHANGE_REQUEST_SIZE 8192
#define MESSAGE_SIZE 1024

enum stage { STAGE_AUTH, STAGE_ACCOUNT, STAGE_PASSWORD, STAGE_COUNT };
/* What cache-kest said: yes, no, or nothing because it cannot be reached. */
enum answer { ANSWER_YES, ANSWER_NO, ANSWER_NO_DAEMON, ANSWER_COUNT };

/* Every answer of the daemon becomes a PAM result here and nowhere else. */
static const int results[STAGE_COUNT][ANSWER_COUNT] = {
    [STAGE_AUTH] = { PAM_SUCCESS, PAM_AUTH_ERR, PAM_AUTHINFO_UNAVAIL },
    [STAGE_ACCOUNT] = { PAM_SUCCESS, PAM_USER_UNKNOWN, PAM_AUTHINFO_UNAVAIL },
    [STAGE_PASSWORD] = { PAM_SUCCESS, PAM_AUTHTOK_ERR, PAM_AUTHINFO_UNAVAIL },
};
static const char *const stage_names[STAGE_COUNT] = { "authentication", "account check", "password change" };

struct options {
    int debug;
};

/* A locked account is told how long it stays locked; the daemon gives the seconds left. */
static void tell_lock(pam_handle_t *pamh, int flags, const char *reply)
{
    long long seconds = 0;
    if (pamh == NULL || (flags & PAM_SILENT) || !json_integer(json_member(reply, "locked"), &seconds) || seconds <= 0)
        return;
    pam_error(pamh, "account locked after too many failed logins, try again in %lld minutes", (seconds + 59) / 60);
}

static enum answer ask_telling(
    pam_handle_t *pamh, int flags, unsigned short port, const char *function, const char *const *argv, size_t argc)
{
    char *reply = NULL;
    if (!kest_call(port, function, argv, argc, &reply))
        return ANSWER_NO_DAEMON;
    enum answer answer = kest_reply_passed(reply) ? ANSWER_YES : ANSWER_NO;
    if (answer == ANSWER_NO)
        tell_lock(pamh, flags, reply);
    free(reply);
    return answer;
}

/* use_first_pass and try_first_pass are read by pam_get_authtok itself. */
static struct options read_options(int argc, const char **argv)
{
    struct options options = { 0 };
    for (int i = 0; i < argc; ++i) {
        if (strcmp(argv[i], "debug") == 0)
            options.debug = 1;
    }
    return options;
}

/* The user when it is a network account, else NULL. */
static const char *network_user(pam_handle_t *pamh)
{
    const char *user = NULL;
    if (pam_get_user(pamh, &user, NULL) != PAM_SUCCESS || user == NULL || user[0] != '@' || user[1] == '\0')
        return NULL;
    return user;
}

static int result_of(enum stage stage, enum answer answer, const char *user, const struct options *options)
{
    if (options->debug)
        log_message(LOG_INFO, SOURCE_PATH, __LINE__, __func__, "%s of %s: %s", stage_names[stage], user,
            answer == ANSWER_YES      ? "yes"
                : answer == ANSWER_NO ? "no"
                                      : "cache-kest unreachable");
    return results[stage][answer];
}

static enum answer ask(unsigned short port, const char *function, const char *const *argv, size_t argc)
{
    return ask_telling(NULL, 0, port, function, argv, argc);
}

PAM_EXTERN int pam_sm_authenticate(pam_handle_t *pamh, int flags, int argc, const char **argv)
{
    struct options options = read_options(argc, argv);
    const char *user = network_user(pamh);
    if (user == NULL)
        return PAM_USER_UNKNOWN;
    const unsigned short port = kest_daemon_port();
    if (port == 0)
        return result_of(STAGE_AUTH, ANSWER_NO_DAEMON, user, &options);
    const char *password = NULL;
    int got = pam_get_authtok(pamh, PAM_AUTHTOK, &password, NULL);
    if (got != PAM_SUCCESS || password == NULL)
        return got == PAM_SUCCESS ? PAM_AUTH_ERR : got;
    const char *arguments[] = { user, password };
    return result_of(STAGE_AUTH, ask_telling(pamh, flags, port, "authenticatePassword", arguments, 2), user, &options);
}

PAM_EXTERN int pam_sm_setcred(pam_handle_t *pamh, int flags, int argc, const char **argv)
{
    (void)flags;
    (void)argc;
    (void)argv;
    return network_user(pamh) != NULL ? PAM_SUCCESS : PAM_IGNORE;
}

/* Other names are PAM_IGNORE here: unknown network accounts must be told apart from local ones. */
PAM_EXTERN int pam_sm_acct_mgmt(pam_handle_t *pamh, int flags, int argc, const char **argv)
{
    (void)flags;
    struct options options = read_options(argc, argv);
    const char *user = network_user(pamh);
    if (user == NULL)
        return PAM_IGNORE;
    return result_of(STAGE_ACCOUNT, ask(kest_daemon_port(), "getAccountByName", &user, 1), user, &options);
}

/* The daemon's answer to a change: code 0 is success; any other answer's "msg" goes to the user. */
static enum answer change_answer(pam_handle_t *pamh, int flags, const char *reply)
{
    long long code = -1;
    if (json_integer(json_member(reply, "code"), &code) && code == 0)
        return ANSWER_YES;
    char message[MESSAGE_SIZE];
    long length = json_string(json_member(reply, "msg"), message, sizeof(message));
    if (length > 0 && (size_t)length < sizeof(message) && !(flags & PAM_SILENT))
        pam_error(pamh, "%s", message);
    return ANSWER_NO;
}

static enum answer change_password(
    pam_handle_t *pamh, int flags, unsigned short port, const char *user, const char *password, const char *old)
{
    char request[CHANGE_REQUEST_SIZE];
    const char *const fields[] = { "username", user, "password", password, "old_password", old };
    if (!kest_json_object(request, sizeof(request), fields, 3)) {
        explicit_bzero(request, sizeof(request));
        log_message(3, SOURCE_PATH, __LINE__, __func__, "password change request of %s too long", user);
        return ANSWER_NO;
    }
    const char *arguments[] = { request };
    char *reply = NULL;
    int answered = kest_call(port, "modifyUser", arguments, 1, &reply);
    explicit_bzero(request, sizeof(request));
    if (!answered)
        return ANSWER_NO_DAEMON;
    enum answer answer = change_answer(pamh, flags, reply);
    free(reply);
    return answer;
}

PAM_EXTERN int pam_sm_chauthtok(pam_handle_t *pamh, int flags, int argc, const char **argv)
{
    struct options options = read_options(argc, argv);
    const char *user = network_user(pamh);
    if (user == NULL)
        return PAM_IGNORE;
    const unsigned short port = kest_daemon_port();
    if (port == 0)
        return result_of(STAGE_PASSWORD, ANSWER_NO_DAEMON, user, &options);
    const char *old = NULL;
    int got = pam_get_authtok(pamh, PAM_OLDAUTHTOK, &old, NULL);
    /* The old password is asked first, as pam_unix does, whatever module asks for the new one. */
    if (flags & PAM_PRELIM_CHECK)
        return got;
    const char *password = NULL;
    if (got == PAM_SUCCESS)
        got = pam_get_authtok(pamh, PAM_AUTHTOK, &password, NULL);
    if (got != PAM_SUCCESS || old == NULL || password == NULL)
        return got == PAM_SUCCESS ? PAM_AUTHTOK_ERR : got;
    return result_of(STAGE_PASSWORD, change_password(pamh, flags, port, user, password, old), user, &options);
}

PAM_EXTERN int pam_sm_open_session(pam_handle_t *pamh, int flags, int argc, const char **argv)
{
    (void)flags;
    (void)argc;
    (void)argv;
    return network_user(pamh) != NULL ? PAM_SUCCESS : PAM_IGNORE;
}

PAM_EXTERN int pam_sm_close_session(pam_handle_t *pamh, int flags, int argc, const char **argv)
{
    (void)flags;
    (void)argc;
    (void)argv;
    return network_user(pamh) != NULL ? PAM_SUCCESS : PAM_IGNORE;
}
