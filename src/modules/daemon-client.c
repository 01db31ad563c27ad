/* daemon-client.c - the modules' function calls to cache-kest */
#define _GNU_SOURCE
#include "daemon-client.h"

#include "common.h"
#include "json-reader.h"
#include "paths.h"

#include <arpa/inet.h>
#include <errno.h>
#include <pthread.h>
#include <signal.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>

#define SOURCE_PATH "src/modules/daemon-client"
#define PROCESS_NAME_SIZE 64
#define PATH_SIZE 4096
#define REQUEST_SIZE 16384
/* A listing of every cached account is the longest reply; far below this even for many thousands. */
#define REPLY_LIMIT (64 * 1024 * 1024)

static pthread_once_t self_once = PTHREAD_ONCE_INIT;
static int self_is_daemon;

/* A process keeps its name for the module's life: an exec loads the module afresh. */
static void find_self(void)
{
    char process[PROCESS_NAME_SIZE];
    memset(process, 0, sizeof(process));
    self_is_daemon = get_process_name(process) && strcmp(process, "cache-kest") == 0;
}

/* The daemon found last, as its pid file was when it was found. Every look-up asks for the daemon, and
 * reading its pid file and /proc/<pid>/cmdline costs more than the look-up's whole exchange. */
struct known_daemon {
    dev_t device;
    ino_t inode;
    off_t size;
    struct timespec changed;
    pid_t pid;
    unsigned short port;
};
static pthread_mutex_t known_lock = PTHREAD_MUTEX_INITIALIZER;
static struct known_daemon known;

static int same_file(const struct known_daemon *daemon, const struct stat *file)
{
    return daemon->device == file->st_dev && daemon->inode == file->st_ino && daemon->size == file->st_size
        && daemon->changed.tv_sec == file->st_mtim.tv_sec && daemon->changed.tv_nsec == file->st_mtim.tv_nsec;
}

/* Still the daemon found before: the same pid file, and its process alive. Never waits on the lock (a
 * child forked while another thread held it must not hang): a busy lock is a miss. */
static unsigned short known_port(const struct stat *file)
{
    if (pthread_mutex_trylock(&known_lock) != 0)
        return 0;
    struct known_daemon daemon = known;
    pthread_mutex_unlock(&known_lock);
    if (daemon.port == 0 || !same_file(&daemon, file))
        return 0;
    return kill(daemon.pid, 0) == 0 || errno == EPERM ? daemon.port : 0;
}

static void remember(const struct stat *file, long pid, unsigned short port)
{
    struct known_daemon daemon = { file->st_dev, file->st_ino, file->st_size, file->st_mtim, (pid_t)pid, port };
    if (daemon.pid <= 0 || pthread_mutex_trylock(&known_lock) != 0)
        return;
    known = daemon;
    pthread_mutex_unlock(&known_lock);
}

unsigned short kest_daemon_port(void)
{
    pthread_once(&self_once, find_self);
    char path[PATH_SIZE];
    struct stat file;
    if (self_is_daemon || !kest_path(KEST_PATH_CACHE_PID, path, sizeof(path)) || stat(path, &file) != 0)
        return 0;
    unsigned short port = known_port(&file);
    if (port != 0)
        return port;
    long pid = 0;
    if (!cache_daemon_port(&port, &pid))
        return 0;
    /* Kept as the file was before it was read: had it changed since, the next look-up reads it again. */
    remember(&file, pid, port);
    return port;
}

static int append_raw(char *out, size_t size, size_t *length, const char *text)
{
    size_t extra = strlen(text);
    if (*length + extra >= size)
        return 0;
    memcpy(out + *length, text, extra);
    *length += extra;
    return 1;
}

/* Written straight into out: no other copy of a password is left on the stack. */
static int append_json_string(char *out, size_t size, size_t *length, const char *text)
{
    static const char hex[] = "0123456789abcdef";
    if (!append_raw(out, size, length, "\""))
        return 0;
    for (const unsigned char *c = (const unsigned char *)text; *c != '\0'; ++c) {
        /* Room for the longest form, \u00XX, then the closing quote and a NUL. */
        if (*length + 8 > size)
            return 0;
        if (*c == '"' || *c == '\\') {
            out[(*length)++] = '\\';
            out[(*length)++] = (char)*c;
        } else if (*c < 0x20) {
            memcpy(out + *length, "\\u00", 4);
            out[*length + 4] = hex[*c >> 4];
            out[*length + 5] = hex[*c & 15];
            *length += 6;
        } else {
            out[(*length)++] = (char)*c;
        }
    }
    return append_raw(out, size, length, "\"");
}

int kest_json_object(char *out, size_t size, const char *const *pairs, size_t count)
{
    size_t length = 0;
    int fits = append_raw(out, size, &length, "{");
    for (size_t i = 0; fits && i < count; ++i)
        fits = (i == 0 || append_raw(out, size, &length, ",")) && append_json_string(out, size, &length, pairs[2 * i])
            && append_raw(out, size, &length, ":") && append_json_string(out, size, &length, pairs[2 * i + 1]);
    if (!fits || !append_raw(out, size, &length, "}"))
        return 0;
    out[length] = '\0';
    return 1;
}

/* The whole frame: length prefix and {"version","functionName","argv"}; 0 when it does not fit. written:
 * how many bytes of out were written either way. */
static size_t build_request(
    char *out, size_t size, const char *function, const char *const *argv, size_t argc, size_t *written)
{
    size_t length = 4;
    int fits = append_raw(out, size, &length, "{\"version\":16777216,\"functionName\":")
        && append_json_string(out, size, &length, function) && append_raw(out, size, &length, ",\"argv\":[");
    for (size_t i = 0; fits && i < argc; ++i)
        fits = (i == 0 || append_raw(out, size, &length, ","))
            && append_json_string(out, size, &length, argv[i] ? argv[i] : "");
    fits = fits && append_raw(out, size, &length, "]}");
    *written = length;
    if (!fits)
        return 0;
    uint32_t payload = htonl((uint32_t)(length - 4));
    memcpy(out, &payload, sizeof(payload));
    return length;
}

int kest_call(unsigned short port, const char *function, const char *const *argv, size_t argc, char **reply)
{
    *reply = NULL;
    if (port == 0)
        return 0;
    char request[REQUEST_SIZE];
    size_t written = 0;
    size_t length = build_request(request, sizeof(request), function, argv, argc, &written);
    int answered = length > 0 && socket_query_frame(port, request, length, reply, REPLY_LIMIT);
    /* Only the bytes written can hold a password. */
    explicit_bzero(request, written);
    if (length == 0)
        log_message(3, SOURCE_PATH, __LINE__, __func__, "request %s too long for cache-kest", function);
    return answered;
}

int kest_reply_passed(const char *reply)
{
    int passed = 0;
    return json_bool(json_member(reply, "pass"), &passed) && passed;
}
