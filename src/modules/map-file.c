/* map-file.c - the process-wide mapping of the account map, checked against the file at each use */
#define _GNU_SOURCE
#include "map-file.h"

#include "common.h"
#include "paths.h"

#include <fcntl.h>
#include <pthread.h>
#include <sched.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#define SOURCE_PATH "src/modules/map-file"
#define PATH_SIZE 4096
/* A look-up holds the lock for a copy into the caller's buffer; a lock busy for this many turns is one a
 * forked child inherited from a thread that is gone, and the look-up goes to the daemon instead. */
#define LOCK_TURNS 1000

struct file_identity {
    dev_t device;
    ino_t inode;
    off_t size;
    struct timespec modified;
    struct timespec changed;
};

struct mapping {
    struct file_identity identity;
    int looked_at; /* identity is the file's last seen version, mapped or refused */
    void *memory; /* NULL when that version was refused */
    size_t length;
    struct kest_map_view view;
};

static pthread_mutex_t map_lock = PTHREAD_MUTEX_INITIALIZER;
static struct mapping current;

static struct file_identity identity_of(const struct stat *info)
{
    struct file_identity identity = { info->st_dev, info->st_ino, info->st_size, info->st_mtim, info->st_ctim };
    return identity;
}

static int same_identity(const struct file_identity *a, const struct file_identity *b)
{
    return a->device == b->device && a->inode == b->inode && a->size == b->size
        && a->modified.tv_sec == b->modified.tv_sec && a->modified.tv_nsec == b->modified.tv_nsec
        && a->changed.tv_sec == b->changed.tv_sec && a->changed.tv_nsec == b->changed.tv_nsec;
}

/* Only root may have written what every process of the machine takes for its accounts. */
static int trusted(const struct stat *info)
{
    return S_ISREG(info->st_mode) && info->st_uid == 0 && (info->st_mode & (S_IWGRP | S_IWOTH)) == 0
        && info->st_size >= (off_t)sizeof(struct kest_map_header) && info->st_size <= (off_t)KEST_MAP_SIZE_LIMIT;
}

static int take_lock(void)
{
    for (int turn = 0; turn < LOCK_TURNS; ++turn) {
        if (pthread_mutex_trylock(&map_lock) == 0)
            return 1;
        sched_yield();
    }
    return 0;
}

static void drop(void)
{
    if (current.memory != NULL)
        munmap(current.memory, current.length);
    memset(&current, 0, sizeof(current));
}

/* Maps the file stat found at path, unless it is not to be trusted; a file replaced between the stat and
 * the open is left for the next call to look at. */
static void take(const char *path, const struct stat *info)
{
    current.identity = identity_of(info);
    current.looked_at = 1;
    if (!trusted(info)) {
        log_message(3, SOURCE_PATH, __LINE__, __func__, "account map %s refused: not a root-only regular file", path);
        return;
    }
    int fd = open(path, O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY);
    if (fd < 0) {
        current.looked_at = 0;
        return;
    }
    struct stat opened;
    void *memory = MAP_FAILED;
    if (fstat(fd, &opened) == 0) {
        struct file_identity identity = identity_of(&opened);
        if (same_identity(&identity, &current.identity))
            memory = mmap(NULL, (size_t)opened.st_size, PROT_READ, MAP_SHARED, fd, 0);
    }
    close(fd);
    if (memory == MAP_FAILED) {
        current.looked_at = 0;
        return;
    }
    if (!kest_map_view_init(&current.view, memory, (size_t)info->st_size)) {
        munmap(memory, (size_t)info->st_size);
        log_message(3, SOURCE_PATH, __LINE__, __func__, "account map %s refused: not of the expected form", path);
        return;
    }
    current.memory = memory;
    current.length = (size_t)info->st_size;
}

enum kest_map_result kest_map_file_use(kest_map_use use, void *context)
{
    char path[PATH_SIZE];
    struct stat info;
    if (!kest_path(KEST_PATH_ACCOUNT_MAP, path, sizeof(path)))
        return KEST_MAP_BROKEN;
    const int found = stat(path, &info) == 0;
    if (!take_lock())
        return KEST_MAP_BROKEN;
    struct file_identity identity;
    if (found)
        identity = identity_of(&info);
    if (!found)
        drop();
    else if (!current.looked_at || !same_identity(&identity, &current.identity)) {
        drop();
        take(path, &info);
    }
    enum kest_map_result result = current.memory != NULL ? use(&current.view, context) : KEST_MAP_BROKEN;
    pthread_mutex_unlock(&map_lock);
    return result;
}
