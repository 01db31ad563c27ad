/* nss-group.c - the group map of the name-service module: the daemon's public group list */
#define _GNU_SOURCE
#include "common.h"
#include "map-file.h"
#include "nss-buffer.h"
#include "nss-listing.h"
#include "paths.h"

#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <nss.h>
#include <pthread.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#define GROUP_FILE KEST_PATH_WORKDIR "/groups.txt"
#define GROUP_FILE_LIMIT (16 * 1024 * 1024)
#define PATH_TEXT_SIZE 4096
#define GROUP_NAME_SIZE 64
#define GID_DIGITS_MAX 10

enum nss_status _nss_kest_getgrnam_r(const char *name, struct group *grp, char *buffer, size_t buflen, int *errnop);
enum nss_status _nss_kest_getgrgid_r(gid_t gid, struct group *grp, char *buffer, size_t buflen, int *errnop);
enum nss_status _nss_kest_setgrent(int stayopen);
enum nss_status _nss_kest_getgrent_r(struct group *grp, char *buffer, size_t buflen, int *errnop);
enum nss_status _nss_kest_endgrent(void);
enum nss_status _nss_kest_initgroups_dyn(
    const char *user, gid_t group, long int *start, long int *size, gid_t **groupsp, long int limit, int *errnop);

/* One line "name:password:gid:member,member" of the file; fields past the fourth are ignored. */
struct group_line {
    int valid;
    const char *name;
    size_t name_length;
    const char *password;
    size_t password_length;
    gid_t gid;
    const char *members;
    size_t members_length;
};

/* The whole file, NUL-terminated, for the caller to free; NULL when it cannot be read. */
static char *read_group_file(void)
{
    char path[PATH_TEXT_SIZE];
    if (!kest_path(GROUP_FILE, path, sizeof(path)))
        return NULL;
    int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return NULL;
    struct stat info;
    char *text = NULL;
    if (fstat(fd, &info) == 0 && info.st_size >= 0 && info.st_size <= GROUP_FILE_LIMIT)
        text = malloc((size_t)info.st_size + 1);
    size_t got = 0;
    while (text != NULL && got < (size_t)info.st_size) {
        ssize_t received = read(fd, text + got, (size_t)info.st_size - got);
        if (received < 0 && errno == EINTR)
            continue;
        /* The daemon rewrites the file whole; a shorter file is taken as far as it goes. */
        if (received <= 0)
            break;
        got += (size_t)received;
    }
    close(fd);
    if (text != NULL)
        text[got] = '\0';
    return text;
}

/* Group ids from the file: decimal, never 0, which the file's writer uses for an unreadable number. */
static int parse_gid(const char *text, size_t length, gid_t *gid)
{
    if (length == 0 || length > GID_DIGITS_MAX)
        return 0;
    uint64_t value = 0;
    for (size_t i = 0; i < length; ++i) {
        if (text[i] < '0' || text[i] > '9')
            return 0;
        value = value * 10 + (uint64_t)(text[i] - '0');
    }
    if (value == 0 || value > UINT32_MAX)
        return 0;
    *gid = (gid_t)value;
    return 1;
}

/* Parses the line at p; returns the start of the next one. */
static const char *read_line(const char *p, struct group_line *line)
{
    const char *end = strchrnul(p, '\n');
    const char *field[4];
    size_t length[4];
    int count = 0;
    for (const char *start = p; count < 4; ++count) {
        const char *colon = memchr(start, ':', (size_t)(end - start));
        const char *stop = colon != NULL ? colon : end;
        field[count] = start;
        length[count] = (size_t)(stop - start);
        if (colon == NULL) {
            ++count;
            break;
        }
        start = colon + 1;
    }
    memset(line, 0, sizeof(*line));
    line->valid = count == 4 && parse_gid(field[2], length[2], &line->gid);
    if (line->valid) {
        line->name = field[0];
        line->name_length = length[0];
        line->password = field[1];
        line->password_length = length[1];
        line->members = field[3];
        line->members_length = length[3];
    }
    return *end != '\0' ? end + 1 : end;
}

/* The next member after *offset; the empty parts that a trailing comma leaves are passed over. */
static int next_member(const struct group_line *line, size_t *offset, const char **member, size_t *length)
{
    while (*offset < line->members_length) {
        const char *start = line->members + *offset;
        const char *comma = memchr(start, ',', line->members_length - *offset);
        *length = comma != NULL ? (size_t)(comma - start) : line->members_length - *offset;
        *offset += *length + 1;
        *member = start;
        if (*length > 0)
            return 1;
    }
    return 0;
}

static int lists_member(const struct group_line *line, const char *user)
{
    size_t user_length = strlen(user), offset = 0, length;
    const char *member;
    while (next_member(line, &offset, &member, &length)) {
        if (length == user_length && memcmp(member, user, length) == 0)
            return 1;
    }
    return 0;
}

static enum nss_status fill_group(
    const struct group_line *line, struct group *grp, char *buffer, size_t buflen, int *errnop)
{
    size_t count = 0, offset = 0, length;
    const char *member;
    while (next_member(line, &offset, &member, &length))
        ++count;

    struct nss_buffer out;
    nss_buffer_init(&out, buffer, buflen);
    char **members = nss_buffer_pointers(&out, count + 1);
    grp->gr_name = nss_buffer_copy(&out, line->name, line->name_length);
    grp->gr_passwd = nss_buffer_copy(&out, line->password, line->password_length);
    grp->gr_gid = line->gid;
    size_t i = 0;
    for (offset = 0; next_member(line, &offset, &member, &length); ++i) {
        char *copy = nss_buffer_copy(&out, member, length);
        if (members != NULL)
            members[i] = copy;
    }
    if (members != NULL)
        members[i] = NULL;
    grp->gr_mem = members;
    return nss_buffer_status(&out, errnop);
}

typedef int (*group_match)(const struct group_line *line, const void *key);

static int has_name(const struct group_line *line, const void *key)
{
    const char *name = key;
    return strlen(name) == line->name_length && memcmp(line->name, name, line->name_length) == 0;
}

static int has_gid(const struct group_line *line, const void *key)
{
    return line->gid == *(const gid_t *)key;
}

static enum nss_status find_group(
    group_match match, const void *key, struct group *grp, char *buffer, size_t buflen, int *errnop)
{
    char *text = read_group_file();
    if (text == NULL)
        return nss_unavailable(errnop);
    enum nss_status status = NSS_STATUS_NOTFOUND;
    struct group_line line;
    for (const char *p = text; *p != '\0';) {
        p = read_line(p, &line);
        if (line.valid && match(&line, key)) {
            status = fill_group(&line, grp, buffer, buflen, errnop);
            break;
        }
    }
    free(text);
    return status == NSS_STATUS_NOTFOUND ? nss_not_found(errnop) : status;
}

/* One look-up of a group in the daemon's map. */
struct group_query {
    const char *name;
    gid_t gid;
    struct group *grp;
    char *buffer;
    size_t buflen;
    int *errnop;
    enum nss_status status;
};

/* A run of the id area, as a record names it; 0 when it does not lie inside. */
static int ids_inside(const struct kest_map_view *view, uint32_t first, uint32_t count)
{
    return (uint64_t)first + count <= view->header.id_count;
}

static enum kest_map_result copy_group(
    const struct kest_map_view *view, const struct kest_map_group *found, struct group_query *query)
{
    const char *name = kest_map_text(view, found->name), *password = kest_map_text(view, found->password);
    if (name == NULL || password == NULL || !ids_inside(view, found->first_id, found->id_count))
        return KEST_MAP_BROKEN;
    struct nss_buffer out;
    nss_buffer_init(&out, query->buffer, query->buflen);
    char **members = nss_buffer_pointers(&out, (size_t)found->id_count + 1);
    query->grp->gr_name = nss_buffer_copy(&out, name, found->name.length);
    query->grp->gr_passwd = nss_buffer_copy(&out, password, found->password.length);
    query->grp->gr_gid = found->gid;
    for (uint32_t i = 0; i < found->id_count; ++i) {
        uint32_t index;
        struct kest_map_member member;
        const char *text;
        if (!kest_map_id(view, found->first_id, i, &index) || kest_map_member_at(view, index, &member) != KEST_MAP_FOUND
            || (text = kest_map_text(view, member.name)) == NULL)
            return KEST_MAP_BROKEN;
        char *copy = nss_buffer_copy(&out, text, member.name.length);
        if (members != NULL)
            members[i] = copy;
    }
    if (members != NULL)
        members[found->id_count] = NULL;
    query->grp->gr_mem = members;
    query->status = nss_buffer_status(&out, query->errnop);
    return KEST_MAP_FOUND;
}

static enum kest_map_result group_of_name(const struct kest_map_view *view, void *context)
{
    struct group_query *query = context;
    struct kest_map_group found;
    enum kest_map_result result = kest_map_group_by_name(view, query->name, &found);
    return result == KEST_MAP_FOUND ? copy_group(view, &found, query) : result;
}

static enum kest_map_result group_of_gid(const struct kest_map_view *view, void *context)
{
    struct group_query *query = context;
    struct kest_map_group found;
    enum kest_map_result result = kest_map_group_by_gid(view, (uint32_t)query->gid, &found);
    return result == KEST_MAP_FOUND ? copy_group(view, &found, query) : result;
}

/* The daemon's map holds the group list as it was published; without one, the file itself is read. */
static enum nss_status map_or_file(kest_map_use from_map, struct group_query *query, group_match match, const void *key)
{
    enum kest_map_result mapped = kest_map_file_use(from_map, query);
    if (mapped == KEST_MAP_FOUND)
        return query->status;
    if (mapped == KEST_MAP_MISSING)
        return nss_not_found(query->errnop);
    return find_group(match, key, query->grp, query->buffer, query->buflen, query->errnop);
}

enum nss_status _nss_kest_getgrnam_r(const char *name, struct group *grp, char *buffer, size_t buflen, int *errnop)
{
    if (name == NULL || name[0] == '\0')
        return nss_not_found(errnop);
    struct group_query query = { name, 0, grp, buffer, buflen, errnop, NSS_STATUS_NOTFOUND };
    return map_or_file(group_of_name, &query, has_name, name);
}

enum nss_status _nss_kest_getgrgid_r(gid_t gid, struct group *grp, char *buffer, size_t buflen, int *errnop)
{
    struct group_query query = { NULL, gid, grp, buffer, buflen, errnop, NSS_STATUS_NOTFOUND };
    return map_or_file(group_of_gid, &query, has_gid, &gid);
}

static struct nss_listing group_walk = NSS_LISTING_INIT;
static int shows_all_special;
static int shows_printing;

/* The special groups mostly repeat the machine's own (sudo, lp, ...), which its files source lists
 * already; a walk of the group database shows them, with their network members, only to the system
 * services that look for members, and lp and lpadmin to the printer tools. Look-ups by name or id and
 * a user's own group list are answered for every process. */
static int shown_in_listing(const struct group_line *line)
{
    char name[GROUP_NAME_SIZE];
    if (line->name_length >= sizeof(name))
        return 1;
    memcpy(name, line->name, line->name_length);
    name[line->name_length] = '\0';
    if (is_special_group(name) != 0 || shows_all_special)
        return 1;
    return shows_printing && (strcmp(name, "lp") == 0 || strcmp(name, "lpadmin") == 0);
}

static void take_groups(struct nss_listing *listing)
{
    shows_all_special = is_trusted_caller();
    shows_printing = is_printer_caller();
    listing->text = read_group_file();
    listing->next = listing->text;
}

enum nss_status _nss_kest_setgrent(int stayopen)
{
    (void)stayopen;
    return nss_listing_restart(&group_walk, take_groups);
}

enum nss_status _nss_kest_getgrent_r(struct group *grp, char *buffer, size_t buflen, int *errnop)
{
    nss_listing_lock(&group_walk, take_groups);
    enum nss_status status = NSS_STATUS_NOTFOUND;
    while (group_walk.next != NULL && *group_walk.next != '\0') {
        struct group_line line;
        const char *after = read_line(group_walk.next, &line);
        if (!line.valid || !shown_in_listing(&line)) {
            group_walk.next = after;
            continue;
        }
        status = fill_group(&line, grp, buffer, buflen, errnop);
        /* A short buffer keeps the line for glibc's retry with a larger one. */
        if (status != NSS_STATUS_TRYAGAIN)
            group_walk.next = after;
        break;
    }
    pthread_mutex_unlock(&group_walk.lock);
    return status == NSS_STATUS_NOTFOUND ? nss_not_found(errnop) : status;
}

enum nss_status _nss_kest_endgrent(void)
{
    return nss_listing_end(&group_walk);
}

static enum nss_status add_group(
    gid_t gid, long int *start, long int *size, gid_t **groupsp, long int limit, int *errnop)
{
    for (long int i = 0; i < *start; ++i) {
        if ((*groupsp)[i] == gid)
            return NSS_STATUS_SUCCESS;
    }
    if (*start >= *size) {
        /* Full at the caller's limit: glibc keeps the groups that fit. */
        if (limit > 0 && *size >= limit)
            return NSS_STATUS_SUCCESS;
        long int grown = *size > 0 ? *size * 2 : 8;
        if (limit > 0 && grown > limit)
            grown = limit;
        gid_t *groups = realloc(*groupsp, (size_t)grown * sizeof(gid_t));
        if (groups == NULL) {
            *errnop = ENOMEM;
            return NSS_STATUS_TRYAGAIN;
        }
        *groupsp = groups;
        *size = grown;
    }
    (*groupsp)[(*start)++] = gid;
    return NSS_STATUS_SUCCESS;
}

/* One user's group list, as initgroups builds it. */
struct member_query {
    const char *user;
    gid_t group;
    long int *start;
    long int *size;
    gid_t **groupsp;
    long int limit;
    int *errnop;
    enum nss_status status;
};

static enum kest_map_result add_member_groups(const struct kest_map_view *view, void *context)
{
    struct member_query *query = context;
    struct kest_map_member member;
    query->status = NSS_STATUS_SUCCESS;
    enum kest_map_result result = kest_map_member_by_name(view, query->user, &member);
    if (result != KEST_MAP_FOUND)
        return result;
    if (!ids_inside(view, member.first_id, member.id_count))
        return KEST_MAP_BROKEN;
    for (uint32_t i = 0; i < member.id_count && query->status == NSS_STATUS_SUCCESS; ++i) {
        uint32_t gid = 0;
        kest_map_id(view, member.first_id, i, &gid);
        if (gid != query->group)
            query->status = add_group(gid, query->start, query->size, query->groupsp, query->limit, query->errnop);
    }
    return KEST_MAP_FOUND;
}

enum nss_status _nss_kest_initgroups_dyn(
    const char *user, gid_t group, long int *start, long int *size, gid_t **groupsp, long int limit, int *errnop)
{
    /* Only network accounts are listed here beyond what the machine's own groups hold. */
    if (user == NULL || user[0] != '@')
        return nss_not_found(errnop);
    struct member_query query = { user, group, start, size, groupsp, limit, errnop, NSS_STATUS_SUCCESS };
    if (kest_map_file_use(add_member_groups, &query) != KEST_MAP_BROKEN)
        return query.status;
    char *text = read_group_file();
    if (text == NULL)
        return nss_unavailable(errnop);
    enum nss_status status = NSS_STATUS_SUCCESS;
    struct group_line line;
    for (const char *p = text; *p != '\0' && status == NSS_STATUS_SUCCESS;) {
        p = read_line(p, &line);
        if (line.valid && line.gid != group && lists_member(&line, user))
            status = add_group(line.gid, start, size, groupsp, limit, errnop);
    }
    free(text);
    return status;
}
