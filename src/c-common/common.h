/* common.h - log facility, caller identity checks and the cache daemon query client */
#ifndef KEST_COMMON_H
#define KEST_COMMON_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

#if defined(__GNUC__)
#define KEST_LIKE_PRINTF(fmt, args) __attribute__((format(printf, fmt, args)))
#define KEST_MUST_USE __attribute__((warn_unused_result))
#else
#define KEST_LIKE_PRINTF(fmt, args)
#define KEST_MUST_USE
#endif

/* Levels are syslog priorities; 8 and above form a trace band shown only with KEST_IAM_LOGLEVEL set. */
void log_message(int level, const char *file, int line, const char *function, const char *format, ...)
    KEST_LIKE_PRINTF(5, 6);

/* Fills out (64 bytes, zeroed by the caller) with the short name of this process; 1 when read. */
int get_process_name(char *out);

int is_trusted_caller(void);
int is_printer_caller(void);
int is_accounts_daemon(void);
/* 0 when the group is one of the special local groups, 1 otherwise (comparison style). */
int is_special_group(const char *group);

int pid_file_exists(void);
/* Reads the first line of the cache daemon's pid file into out (64 bytes); 1 when non-empty. */
int read_pid_file(char *out);
int is_cache_daemon_running(void);

/* Sends one ready-made frame to the cache daemon and receives its reply body into reply. */
int socket_query(const void *request, size_t request_length, unsigned char *reply, size_t reply_capacity) KEST_MUST_USE;
/* As socket_query, to the given port (0: the one in the pid file), but takes the whole reply frame,
 * however many receives it needs, within the same receive time-out. On success *reply is the body,
 * NUL-terminated, allocated with malloc for the caller to free; a body longer than max_length is
 * refused. */
int socket_query_frame(
    unsigned short port, const void *request, size_t request_length, char **reply, size_t max_length) KEST_MUST_USE;
int is_connect(int socket);
int read_port(unsigned short *port);
/* One read of the pid file: the port of the cache daemon, and its pid when pid is not NULL, when the pid
 * it names runs cache-kest. */
int cache_daemon_port(unsigned short *port, long *pid);

#ifdef __cplusplus
}
#endif

#endif
