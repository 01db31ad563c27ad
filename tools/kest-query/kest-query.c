/* kest-query.c - asks the running cache daemon one function call, the way the machine's modules do */
#include "common.h"

#include <arpa/inet.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#define REQUEST_SIZE 65536
#define REPLY_SIZE 65536

/* Appends text as a JSON string; returns the new length, or 0 when it does not fit. */
static size_t append_json_string(char *out, size_t length, size_t size, const char *text)
{
    static const char hex[] = "0123456789abcdef";
    if (length + 2 >= size)
        return 0;
    out[length++] = '"';
    for (const unsigned char *c = (const unsigned char *)text; *c; ++c) {
        if (length + 7 >= size)
            return 0;
        if (*c == '"' || *c == '\\') {
            out[length++] = '\\';
            out[length++] = (char)*c;
        } else if (*c < 0x20) {
            length += (size_t)snprintf(out + length, size - length, "\\u00%c%c", hex[*c >> 4], hex[*c & 15]);
        } else {
            out[length++] = (char)*c;
        }
    }
    out[length++] = '"';
    return length;
}

static size_t append_text(char *out, size_t length, size_t size, const char *text)
{
    size_t extra = strlen(text);
    if (length + extra >= size)
        return 0;
    memcpy(out + length, text, extra);
    return length + extra;
}

static int usage(const char *program)
{
    fprintf(stderr,
            "usage: %s FUNCTION [ARGUMENT...]\n"
            "Sends {\"version\", \"functionName\", \"argv\"} to cache-kest and prints its reply.\n"
            "Functions: queryAccountName NAME, queryUid UID, authenticatePassword NAME PASSWORD, modifyUser JSON\n",
            program);
    return 2;
}

int main(int argc, char **argv)
{
    if (argc < 2 || strcmp(argv[1], "--help") == 0)
        return usage(argv[0]);

    static char request[REQUEST_SIZE];
    size_t length = 4;
    length = append_text(request, length, sizeof(request), "{\"version\":16777216,\"functionName\":");
    length = length ? append_json_string(request, length, sizeof(request), argv[1]) : 0;
    length = length ? append_text(request, length, sizeof(request), ",\"argv\":[") : 0;
    for (int i = 2; i < argc && length; ++i) {
        if (i > 2)
            length = append_text(request, length, sizeof(request), ",");
        length = length ? append_json_string(request, length, sizeof(request), argv[i]) : 0;
    }
    length = length ? append_text(request, length, sizeof(request), "]}") : 0;
    if (length == 0) {
        fprintf(stderr, "%s: request too long\n", argv[0]);
        return 2;
    }
    uint32_t payload = htonl((uint32_t)(length - 4));
    memcpy(request, &payload, sizeof(payload));

    static unsigned char reply[REPLY_SIZE];
    if (!socket_query(request, length, reply, sizeof(reply))) {
        fprintf(stderr, "%s: no answer from cache-kest\n", argv[0]);
        return 1;
    }
    printf("%s\n", (const char *)reply);
    return 0;
}
