/* callerprobe.c - prints the caller checks as seen by a process started under any name */
#define _GNU_SOURCE
#include "common.h"

#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

int main(int argc, char **argv)
{
    (void)argc;
    (void)argv;
    /* Re-run with an empty first argument so that no process name can be read. */
    if (getenv("KEST_PROBE_BLANK_NAME") != NULL) {
        unsetenv("KEST_PROBE_BLANK_NAME");
        char *const blank[] = { "", NULL };
        execv("/proc/self/exe", blank);
        return 99;
    }
    printf("%d %d %d\n", is_trusted_caller(), is_printer_caller(), is_accounts_daemon());
    return 0;
}
