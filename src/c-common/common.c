/* common.c - log facility, caller identity checks and the cache daemon query client */
#define _GNU_SOURCE
#include "common.h"

#include "paths.h"

#include <arpa/inet.h>
#include <errno.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <stdarg.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <syslog.h>
#include <time.h>
#include <unistd.h>

#define SOURCE_PATH "src/c-common/common"
#define PROCESS_NAME_SIZE 64
#define TIMESTAMP_SIZE 256
#define BODY_SIZE 8192
#define LINE_SIZE 32767
#define CMDLINE_READ_SIZE 256
#define PID_TEXT_SIZE 64
/* Room for an account entry, so that a look-up takes its reply in one receive. */
#define FIRST_RECEIVE_SIZE 2048
#define QUERY_TIMEOUT_SECONDS 5
#define PATH_MAX_TEXT 4096

static int env_is_set(const char *name)
{
    const char *value = getenv(name);
    return value != NULL && value[0] != '\0';
}

void log_message(int level, const char *file, int line, const char *function, const char *format, ...)
{
    if (level >= 8 && !env_is_set("KEST_IAM_LOGLEVEL"))
        return;
    if (file == NULL || function == NULL || format == NULL)
        return;

    char timestamp[TIMESTAMP_SIZE];
    char process[PROCESS_NAME_SIZE];
    char body[BODY_SIZE];
    char text[LINE_SIZE];
    memset(timestamp, 0, sizeof(timestamp));
    memset(process, 0, sizeof(process));
    memset(body, 0, sizeof(body));
    memset(text, 0, sizeof(text));

    unsigned int pid = (unsigned int)getpid();
    time_t now = time(NULL);
    struct tm local;
    if (localtime_r(&now, &local) != NULL)
        strftime(timestamp, TIMESTAMP_SIZE - 1, "%Y-%m-%d %H:%M:%S", &local);

    get_process_name(process);
    if (process[0] == '\0')
        return;

    const char *user = getenv("USER");
    unsigned int uid = getuid(), euid = geteuid(), gid = getgid(), egid = getegid();

    va_list args;
    va_start(args, format);
    vsnprintf(body, BODY_SIZE - 2, format, args);
    va_end(args);

    /* The finished text is handed on through "%s" so that a "%" in the body is never interpreted. */
    if (user != NULL)
        snprintf(text, LINE_SIZE - 2, "%s process: %s(%u), user: %s(%u,%u, %u,%u), %s, %u, %s, %s ", timestamp, process,
            pid, user, uid, euid, gid, egid, file, (unsigned int)line, function, body);
    else
        snprintf(text, LINE_SIZE - 2, "%s process: %s(%u), user: %u,%u, %u,%u, %s, %u, %s, %s  ", timestamp, process,
            pid, uid, euid, gid, egid, file, (unsigned int)line, function, body);

    syslog(level, "%s", text);
    if (level <= 4)
        fprintf(stderr, "%s\n", text);
    else if (level >= 8)
        fprintf(stdout, "%s\n", text);
}

int get_process_name(char *out)
{
    FILE *file = fopen("/proc/self/cmdline", "re");
    if (file == NULL)
        return 0;
    char argument[CMDLINE_READ_SIZE];
    memset(argument, 0, sizeof(argument));
    char *read = fgets(argument, CMDLINE_READ_SIZE, file);
    fclose(file);
    if (read == NULL || argument[0] == '\0')
        return 0;

    const char *slash = strrchr(argument, '/');
    const char *name = slash ? slash + 1 : argument;
    /* One byte short of the 64-byte buffer so the result always stays terminated. */
    size_t length = strnlen(name, PROCESS_NAME_SIZE - 1);
    memcpy(out, name, length);
    out[length] = '\0';
    if (length > 0 && out[length - 1] == '\n')
        out[length - 1] = '\0';
    return 1;
}

static int process_name_in(const char *const *names, size_t count, int unreadable)
{
    char process[CMDLINE_READ_SIZE];
    memset(process, 0, sizeof(process));
    if (!get_process_name(process) || process[0] == '\0')
        return unreadable;
    for (size_t i = 0; i < count; ++i) {
        if (strcmp(process, names[i]) == 0)
            return 1;
    }
    return 0;
}

#define COUNT_OF(array) (sizeof(array) / sizeof((array)[0]))

int is_trusted_caller(void)
{
    static const char *const names[]
        = { "systemd-logind", "systemd-coredump", "systemd-journald", "accounts-daemon", "sudo", "cache-kest" };
    return process_name_in(names, COUNT_OF(names), 1);
}

int is_printer_caller(void)
{
    static const char *const names[] = { "lpadmin", "ose-printer" };
    return process_name_in(names, COUNT_OF(names), 1);
}

int is_accounts_daemon(void)
{
    static const char *const names[] = { "accounts-daemon" };
    return process_name_in(names, COUNT_OF(names), 0);
}

int is_special_group(const char *group)
{
    static const char *const groups[] = { "users", "kest", "sudo", "lp", "lpadmin", "scanner", "dialout" };
    if (group == NULL)
        return 1;
    for (size_t i = 0; i < COUNT_OF(groups); ++i) {
        if (strcmp(group, groups[i]) == 0)
            return 0;
    }
    return 1;
}

static int cache_pid_path(char *out, size_t size)
{
    return kest_path(KEST_PATH_CACHE_PID, out, size);
}

int pid_file_exists(void)
{
    char path[PATH_MAX_TEXT];
    struct stat info;
    if (!cache_pid_path(path, sizeof(path)) || lstat(path, &info) != 0)
        return 0;
    return info.st_size > 0 ? 1 : 0;
}

/* The pid file read once: its first line (the pid) and its last line of two or more characters (the
 * port), each without line ends; either may come back empty. 0 when the file cannot be read. */
static int read_pid_lines(char *pid, char *port)
{
    char path[PATH_MAX_TEXT];
    if (!cache_pid_path(path, sizeof(path)))
        return 0;
    FILE *file = fopen(path, "re");
    if (file == NULL)
        return 0;
    memset(pid, 0, PID_TEXT_SIZE);
    memset(port, 0, PID_TEXT_SIZE);
    char line[PID_TEXT_SIZE];
    for (int first = 1; fgets(line, PID_TEXT_SIZE, file) != NULL; first = 0) {
        if (first)
            memcpy(pid, line, PID_TEXT_SIZE);
        if (strlen(line) >= 2)
            memcpy(port, line, PID_TEXT_SIZE);
    }
    fclose(file);
    for (char *text = pid; text != NULL; text = text == pid ? port : NULL) {
        size_t length = strlen(text);
        while (length > 0 && (text[length - 1] == '\n' || text[length - 1] == '\r'))
            text[--length] = '\0';
    }
    return 1;
}

int read_pid_file(char *out)
{
    char port[PID_TEXT_SIZE];
    return pid_file_exists() && read_pid_lines(out, port) && out[0] != '\0';
}

/* 1 when /proc/<pid>/cmdline names the cache daemon. */
static int is_cache_daemon_pid(const char *pid)
{
    static const char daemon_name[] = "cache-kest";
    const size_t name_length = sizeof(daemon_name) - 1;
    char buffer[CMDLINE_READ_SIZE];
    memset(buffer, 0, sizeof(buffer));
    snprintf(buffer, sizeof(buffer), "/proc/%s/cmdline", pid);
    struct stat info;
    if (lstat(buffer, &info) != 0)
        return 0;
    int fd = open(buffer, O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return 0;
    memset(buffer, 0, sizeof(buffer));
    ssize_t got = read(fd, buffer, sizeof(buffer) - 1);
    close(fd);
    if (got <= 0)
        return 0;

    size_t length = strlen(buffer);
    return length > name_length - 1 && strcmp(buffer + length - name_length, daemon_name) == 0 ? 1 : 0;
}

int is_cache_daemon_running(void)
{
    char pid[PID_TEXT_SIZE];
    memset(pid, 0, sizeof(pid));
    /* Without a pid "/proc//cmdline" would name the kernel's command line. */
    if (!read_pid_file(pid))
        return 0;
    return is_cache_daemon_pid(pid);
}

static int parse_port(const char *text, unsigned short *port)
{
    size_t length = strlen(text);
    if (length == 0)
        return 0;
    for (size_t i = 0; i < length; ++i) {
        if (text[i] < '0' || text[i] > '9')
            return 0;
    }
    *port = (unsigned short)strtoul(text, NULL, 10);
    return 1;
}

int cache_daemon_port(unsigned short *port, long *pid)
{
    char pid_text[PID_TEXT_SIZE];
    char text[PID_TEXT_SIZE];
    if (port == NULL || !read_pid_lines(pid_text, text) || pid_text[0] == '\0' || !is_cache_daemon_pid(pid_text)
        || !parse_port(text, port))
        return 0;
    if (pid != NULL)
        *pid = strtol(pid_text, NULL, 10);
    return 1;
}

int is_connect(int socket)
{
    int error = 0;
    socklen_t length = sizeof(error);
    int result = getsockopt(socket, SOL_SOCKET, SO_ERROR, &error, &length);
    if (result != 0) {
        log_message(3, SOURCE_PATH, 269, "is_connect", "getsockopt error code: %d", result);
        return 0;
    }
    if (error != 0) {
        log_message(3, SOURCE_PATH, 273, "is_connect", "socket error code: %d, detail: %s", error, strerror(error));
        return 0;
    }
    return 1;
}

static int set_timeout(int socket, int option)
{
    struct timeval timeout = { QUERY_TIMEOUT_SECONDS, 0 };
    return setsockopt(socket, SOL_SOCKET, option, &timeout, sizeof(timeout));
}

static int fail_query(const char *function, int socket, int line, const char *format)
{
    int code = errno;
    log_message(3, SOURCE_PATH, line, function, format, code, strerror(code));
    if (socket >= 0)
        close(socket);
    return 0;
}

static int fail_connection(const char *function, int socket, int line, const char *format)
{
    fail_query(function, socket, line, format);
    return -1;
}

/* The time seconds from now, for the waits below. */
static void deadline_in(struct timespec *deadline, int seconds)
{
    clock_gettime(CLOCK_MONOTONIC, deadline);
    deadline->tv_sec += seconds;
}

static long milliseconds_until(const struct timespec *deadline)
{
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return (deadline->tv_sec - now.tv_sec) * 1000 + (deadline->tv_nsec - now.tv_nsec) / 1000000;
}

/* Waits until the socket is ready for events, or fails with errno set once the deadline has passed. */
static int wait_for(int fd, short events, const struct timespec *deadline)
{
    for (;;) {
        long wait = milliseconds_until(deadline);
        if (wait <= 0) {
            errno = ETIMEDOUT;
            return 0;
        }
        struct pollfd ready = { fd, events, 0 };
        int polled = poll(&ready, 1, (int)wait);
        if (polled > 0)
            return 1;
        if (polled < 0 && errno != EINTR)
            return 0;
    }
}

/* The whole request, or 0 with errno set; a send cut short would leave the daemon waiting on half a frame. */
static int send_all(int fd, const char *request, size_t length, const struct timespec *deadline)
{
    for (size_t sent = 0; sent < length;) {
        ssize_t now = send(fd, request + sent, length - sent, MSG_NOSIGNAL | MSG_DONTWAIT);
        if (now > 0)
            sent += (size_t)now;
        else if (now < 0 && errno == EAGAIN && !wait_for(fd, POLLOUT, deadline))
            return 0;
        else if (now < 0 && errno != EAGAIN && errno != EINTR)
            return 0;
    }
    return 1;
}

/* Connects to the daemon; the socket, or -1 after one log line. */
static int connect_daemon(const char *function, unsigned short port)
{
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return fail_connection(function, -1, 288, "socket init failed, code: %d, detail: %s");

    struct sockaddr_in address;
    memset(&address, 0, sizeof(address));
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (port == 0 && (!pid_file_exists() || !read_port(&port)))
        return fail_connection(function, fd, 297, "read port failed, code: %d, detail: %s");
    address.sin_port = htons(port);

    if (connect(fd, (struct sockaddr *)&address, sizeof(address)) != 0)
        return fail_connection(function, fd, 303, "connect socket failed, code: %d, detail: %s");
    return fd;
}

/* Connects to the daemon and sends the request; the socket, ready to receive, or -1 after one log line. */
static int send_query(const char *function, unsigned short port, const void *request, size_t request_length)
{
    int fd = connect_daemon(function, port);
    if (fd < 0)
        return -1;
    if (!is_connect(fd)) {
        close(fd);
        return -1;
    }

    struct timespec deadline;
    deadline_in(&deadline, QUERY_TIMEOUT_SECONDS);
    if (!send_all(fd, request, request_length, &deadline))
        return fail_connection(function, fd, 313, "send message failed, code: %d, detail: %s");
    set_timeout(fd, SO_RCVTIMEO);
    return fd;
}

int socket_query(const void *request, size_t request_length, unsigned char *reply, size_t reply_capacity)
{
    int fd = send_query("socket_query", 0, request, request_length);
    if (fd < 0)
        return 0;
    ssize_t received = recv(fd, reply, reply_capacity, 0);
    if (received < 0)
        return fail_query("socket_query", fd, 319, "receive message failed, code: %d, detail: %s");
    if (received < 4) {
        /* A peer that closes before a whole length prefix arrived sent no reply. */
        errno = received == 0 ? ECONNRESET : EPROTO;
        return fail_query("socket_query", fd, 319, "receive message failed, code: %d, detail: %s");
    }

    uint32_t prefix;
    memcpy(&prefix, reply, sizeof(prefix));
    size_t length = ntohl(prefix);
    size_t available = (size_t)received - 4;
    /* Only bytes this single receive produced are moved; the rest of the buffer is zeroed. */
    size_t body = length < available ? length : available;
    memmove(reply, reply + 4, body);
    memset(reply + body, 0, reply_capacity - body);
    close(fd);
    return 1;
}

static char *drop_frame(unsigned char *frame, int code)
{
    free(frame);
    errno = code;
    return NULL;
}

/* One frame's body, NUL-terminated, or NULL with errno set. A short reply is taken in one receive. */
static char *receive_frame(int fd, size_t max_length, const struct timespec *deadline)
{
    size_t capacity = FIRST_RECEIVE_SIZE, got = 0, needed = 4;
    unsigned char *frame = malloc(capacity + 1);
    if (frame == NULL)
        return drop_frame(frame, ENOMEM);
    while (got < needed) {
        if (!wait_for(fd, POLLIN, deadline))
            return drop_frame(frame, errno);
        ssize_t received = recv(fd, frame + got, capacity - got, MSG_DONTWAIT);
        if (received == 0)
            return drop_frame(frame, ECONNRESET);
        if (received < 0 && errno != EINTR && errno != EAGAIN)
            return drop_frame(frame, errno);
        got += received > 0 ? (size_t)received : 0;
        if (needed > 4 || got < 4)
            continue;
        uint32_t prefix;
        memcpy(&prefix, frame, sizeof(prefix));
        if (ntohl(prefix) > max_length)
            return drop_frame(frame, EMSGSIZE);
        needed = 4 + (size_t)ntohl(prefix);
        if (needed <= capacity)
            continue;
        unsigned char *larger = realloc(frame, needed + 1);
        if (larger == NULL)
            return drop_frame(frame, ENOMEM);
        frame = larger;
        capacity = needed;
    }
    memmove(frame, frame + 4, needed - 4);
    frame[needed - 4] = '\0';
    return (char *)frame;
}

int socket_query_frame(unsigned short port, const void *request, size_t request_length, char **reply, size_t max_length)
{
    static const char function[] = "socket_query_frame";
    if (reply == NULL)
        return 0;
    *reply = NULL;
    int fd = connect_daemon(function, port);
    if (fd < 0)
        return 0;
    /* However many segments the exchange takes, each way must be done within one time-out. */
    struct timespec deadline;
    deadline_in(&deadline, QUERY_TIMEOUT_SECONDS);
    if (!send_all(fd, request, request_length, &deadline))
        return fail_query(function, fd, 313, "send message failed, code: %d, detail: %s");
    deadline_in(&deadline, QUERY_TIMEOUT_SECONDS);
    *reply = receive_frame(fd, max_length, &deadline);
    if (*reply == NULL)
        return fail_query(function, fd, 319, "receive message failed, code: %d, detail: %s");
    close(fd);
    return 1;
}

int read_port(unsigned short *port)
{
    char pid[PID_TEXT_SIZE];
    char text[PID_TEXT_SIZE];
    return port != NULL && read_pid_lines(pid, text) && parse_port(text, port);
}
