/* account-map.h - look-ups in an account map held in memory, every offset bounded by its size */
#ifndef KEST_ACCOUNT_MAP_H
#define KEST_ACCOUNT_MAP_H

#include "account-map-format.h"

#include <stddef.h>
#include <stdint.h>

struct kest_map_view {
    const unsigned char *base;
    size_t size;
    struct kest_map_header header;
};

/* Results of the look-ups: the map may be cut or corrupt anywhere past its header, so that a look-up
 * can find it broken too. */
enum kest_map_result { KEST_MAP_BROKEN = -1, KEST_MAP_MISSING = 0, KEST_MAP_FOUND = 1 };

/* 1 when data holds a map whose header fits its size and whose tables and areas lie inside it. */
int kest_map_view_init(struct kest_map_view *view, const void *data, size_t size);

enum kest_map_result kest_map_account_by_name(
    const struct kest_map_view *view, const char *name, struct kest_map_account *out);
enum kest_map_result kest_map_account_by_uid(
    const struct kest_map_view *view, uint32_t uid, struct kest_map_account *out);
enum kest_map_result kest_map_member_by_name(
    const struct kest_map_view *view, const char *name, struct kest_map_member *out);
enum kest_map_result kest_map_group_by_name(
    const struct kest_map_view *view, const char *name, struct kest_map_group *out);
enum kest_map_result kest_map_group_by_gid(const struct kest_map_view *view, uint32_t gid, struct kest_map_group *out);
/* A member record by number, for a group's member list. */
enum kest_map_result kest_map_member_at(const struct kest_map_view *view, uint32_t index, struct kest_map_member *out);

/* KEST_MAP_FOUND when the map says, at now (seconds since the epoch), that the domain server has no such
 * account; the caller still checks that the daemon that said so runs (header.daemon_pid). */
enum kest_map_result kest_map_negative_name(const struct kest_map_view *view, const char *name, int64_t now);
enum kest_map_result kest_map_negative_uid(const struct kest_map_view *view, uint32_t uid, int64_t now);

/* The text's bytes (not NUL-terminated), or NULL when it lies outside the string area. */
const char *kest_map_text(const struct kest_map_view *view, struct kest_map_text text);
/* The id at first + i of the id area; 0 when outside it. */
int kest_map_id(const struct kest_map_view *view, uint32_t first, uint32_t i, uint32_t *out);

#endif
