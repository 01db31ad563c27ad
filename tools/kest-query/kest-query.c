/* kest-query.c - asks the running cache daemon one function call, the way the machine's modules do */
#include "daemon-client.h"

#include <stdio.h>
#include <stdlib.h>
#include <string.h>

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
    char *reply = NULL;
    if (!kest_call(kest_daemon_port(), argv[1], (const char *const *)argv + 2, (size_t)argc - 2, &reply)) {
        fprintf(stderr, "%s: no answer from cache-kest\n", argv[0]);
        return 1;
    }
    printf("%s\n", reply);
    free(reply);
    return 0;
}
