/* daemon-client.h - the modules' function calls to cache-kest */
#ifndef KEST_DAEMON_CLIENT_H
#define KEST_DAEMON_CLIENT_H

#include <stddef.h>

/* The port of cache-kest when it runs and this process is not cache-kest itself, which must never wait
 * on its own request loop; 0 otherwise. Resolved once for the calls of one look-up or login. No log
 * line either way: a machine without the daemon is not an error here. */
unsigned short kest_daemon_port(void);

/* Sends {"version","functionName","argv"} to cache-kest at port (from kest_daemon_port) and takes its
 * whole reply: 1 and *reply (the JSON text, to be freed with free()), or 0 and NULL when the daemon is
 * unreachable (port 0) or the exchange failed. The request buffer is wiped afterwards: the arguments
 * may hold a password. */
int kest_call(unsigned short port, const char *function, const char *const *argv, size_t argc, char **reply);

/* 1 when the reply is an object whose "pass" is true. */
int kest_reply_passed(const char *reply);

/* Writes {"key":"value",...} of count key and value pairs, NUL-terminated; 0 when it does not fit. */
int kest_json_object(char *out, size_t size, const char *const *pairs, size_t count);

#endif
