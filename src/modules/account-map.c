/* account-map.c - look-ups in an account map held in memory, every offset bounded by its size */
#include "account-map.h"

#include <string.h>

/* One hash index over one record table. */
struct map_index {
    uint32_t slots;
    uint32_t offset;
    uint32_t count;
    uint32_t records;
    size_t record_size;
};

typedef int (*record_match)(const struct kest_map_view *view, const void *record, const void *key);

static int inside(const struct kest_map_view *view, uint64_t offset, uint64_t length)
{
    return offset % 4 == 0 && offset <= view->size && length <= view->size - offset;
}

static int is_power_of_two(uint32_t value)
{
    return value != 0 && (value & (value - 1)) == 0;
}

int kest_map_view_init(struct kest_map_view *view, const void *data, size_t size)
{
    memset(view, 0, sizeof(*view));
    if (data == NULL || size < sizeof(view->header) || size > KEST_MAP_SIZE_LIMIT)
        return 0;
    memcpy(&view->header, data, sizeof(view->header));
    view->base = data;
    view->size = size;
    const struct kest_map_header *h = &view->header;
    const uint64_t word = sizeof(uint32_t);
    return memcmp(h->magic, KEST_MAP_MAGIC, KEST_MAP_MAGIC_SIZE) == 0 && h->byte_order == KEST_MAP_BYTE_ORDER
        && h->size == size && is_power_of_two(h->account_slots) && is_power_of_two(h->member_slots)
        && is_power_of_two(h->group_slots)
        && inside(view, h->accounts, (uint64_t)h->account_count * sizeof(struct kest_map_account))
        && inside(view, h->account_names, h->account_slots * word)
        && inside(view, h->account_uids, h->account_slots * word)
        && inside(view, h->members, (uint64_t)h->member_count * sizeof(struct kest_map_member))
        && inside(view, h->member_names, h->member_slots * word)
        && inside(view, h->groups, (uint64_t)h->group_count * sizeof(struct kest_map_group))
        && inside(view, h->group_names, h->group_slots * word) && inside(view, h->group_gids, h->group_slots * word)
        && inside(view, h->ids, h->id_count * word) && h->strings <= size && h->string_size <= size - h->strings
        && is_power_of_two(h->negative_slots)
        && inside(view, h->negatives, (uint64_t)h->negative_count * sizeof(struct kest_map_negative))
        && inside(view, h->negative_names, h->negative_slots * word)
        && inside(view, h->negative_uids, h->negative_slots * word) && h->negative_strings <= size
        && h->negative_string_size <= size - h->negative_strings;
}

static const char *text_in(
    const struct kest_map_view *view, uint32_t area, uint32_t area_size, struct kest_map_text text)
{
    if (text.offset > area_size || text.length > area_size - text.offset)
        return NULL;
    return (const char *)view->base + area + text.offset;
}

const char *kest_map_text(const struct kest_map_view *view, struct kest_map_text text)
{
    return text_in(view, view->header.strings, view->header.string_size, text);
}

int kest_map_id(const struct kest_map_view *view, uint32_t first, uint32_t i, uint32_t *out)
{
    const uint64_t at = (uint64_t)first + i;
    if (at >= view->header.id_count)
        return 0;
    memcpy(out, view->base + view->header.ids + at * sizeof(uint32_t), sizeof(*out));
    return 1;
}

static int text_is(const struct kest_map_view *view, struct kest_map_text text, const char *key)
{
    const char *bytes = kest_map_text(view, text);
    size_t length = strlen(key);
    return bytes != NULL && text.length == length && memcmp(bytes, key, length) == 0;
}

/* Walks the probe sequence of hash; a slot naming a record past the table is a broken map. */
static enum kest_map_result probe(const struct kest_map_view *view, const struct map_index *index, uint32_t hash,
    record_match match, const void *key, void *out)
{
    const uint32_t mask = index->slots - 1;
    for (uint32_t step = 0; step < index->slots; ++step) {
        uint32_t slot;
        memcpy(&slot, view->base + index->offset + (size_t)((hash + step) & mask) * sizeof(slot), sizeof(slot));
        if (slot == 0)
            return KEST_MAP_MISSING;
        if (slot > index->count)
            return KEST_MAP_BROKEN;
        memcpy(out, view->base + index->records + (size_t)(slot - 1) * index->record_size, index->record_size);
        if (match(view, out, key))
            return KEST_MAP_FOUND;
    }
    return KEST_MAP_MISSING;
}

static int account_has_name(const struct kest_map_view *view, const void *record, const void *key)
{
    return text_is(view, ((const struct kest_map_account *)record)->name, key);
}

static int account_has_uid(const struct kest_map_view *view, const void *record, const void *key)
{
    (void)view;
    return ((const struct kest_map_account *)record)->uid == *(const uint32_t *)key;
}

static int member_has_name(const struct kest_map_view *view, const void *record, const void *key)
{
    return text_is(view, ((const struct kest_map_member *)record)->name, key);
}

static int group_has_name(const struct kest_map_view *view, const void *record, const void *key)
{
    return text_is(view, ((const struct kest_map_group *)record)->name, key);
}

static int group_has_gid(const struct kest_map_view *view, const void *record, const void *key)
{
    (void)view;
    return ((const struct kest_map_group *)record)->gid == *(const uint32_t *)key;
}

static int negative_has_name(const struct kest_map_view *view, const void *record, const void *key)
{
    const struct kest_map_text name = ((const struct kest_map_negative *)record)->name;
    const char *bytes = text_in(view, view->header.negative_strings, view->header.negative_string_size, name);
    size_t length = strlen(key);
    return bytes != NULL && name.length == length && memcmp(bytes, key, length) == 0;
}

static int negative_has_uid(const struct kest_map_view *view, const void *record, const void *key)
{
    (void)view;
    const struct kest_map_negative *negative = record;
    return negative->name.length == 0 && negative->uid == *(const uint32_t *)key;
}

static struct map_index account_index(const struct kest_map_view *view, uint32_t offset)
{
    const struct kest_map_header *h = &view->header;
    struct map_index index
        = { h->account_slots, offset, h->account_count, h->accounts, sizeof(struct kest_map_account) };
    return index;
}

static struct map_index group_index(const struct kest_map_view *view, uint32_t offset)
{
    const struct kest_map_header *h = &view->header;
    struct map_index index = { h->group_slots, offset, h->group_count, h->groups, sizeof(struct kest_map_group) };
    return index;
}

static struct map_index negative_index(const struct kest_map_view *view, uint32_t offset)
{
    const struct kest_map_header *h = &view->header;
    struct map_index index
        = { h->negative_slots, offset, h->negative_count, h->negatives, sizeof(struct kest_map_negative) };
    return index;
}

static uint32_t name_hash(const char *name)
{
    return kest_map_hash_text(name, strlen(name));
}

enum kest_map_result kest_map_account_by_name(
    const struct kest_map_view *view, const char *name, struct kest_map_account *out)
{
    const struct map_index index = account_index(view, view->header.account_names);
    return probe(view, &index, name_hash(name), account_has_name, name, out);
}

enum kest_map_result kest_map_account_by_uid(
    const struct kest_map_view *view, uint32_t uid, struct kest_map_account *out)
{
    const struct map_index index = account_index(view, view->header.account_uids);
    return probe(view, &index, kest_map_hash_id(uid), account_has_uid, &uid, out);
}

enum kest_map_result kest_map_member_by_name(
    const struct kest_map_view *view, const char *name, struct kest_map_member *out)
{
    const struct kest_map_header *h = &view->header;
    const struct map_index index
        = { h->member_slots, h->member_names, h->member_count, h->members, sizeof(struct kest_map_member) };
    return probe(view, &index, name_hash(name), member_has_name, name, out);
}

enum kest_map_result kest_map_group_by_name(
    const struct kest_map_view *view, const char *name, struct kest_map_group *out)
{
    const struct map_index index = group_index(view, view->header.group_names);
    return probe(view, &index, name_hash(name), group_has_name, name, out);
}

enum kest_map_result kest_map_group_by_gid(const struct kest_map_view *view, uint32_t gid, struct kest_map_group *out)
{
    const struct map_index index = group_index(view, view->header.group_gids);
    return probe(view, &index, kest_map_hash_id(gid), group_has_gid, &gid, out);
}

enum kest_map_result kest_map_member_at(const struct kest_map_view *view, uint32_t index, struct kest_map_member *out)
{
    if (index >= view->header.member_count)
        return KEST_MAP_BROKEN;
    memcpy(out, view->base + view->header.members + (size_t)index * sizeof(*out), sizeof(*out));
    return KEST_MAP_FOUND;
}

/* An entry found is one that stands only before its end. */
static enum kest_map_result standing(enum kest_map_result found, const struct kest_map_negative *negative, int64_t now)
{
    return found == KEST_MAP_FOUND && now >= negative->until ? KEST_MAP_MISSING : found;
}

enum kest_map_result kest_map_negative_name(const struct kest_map_view *view, const char *name, int64_t now)
{
    const struct map_index index = negative_index(view, view->header.negative_names);
    struct kest_map_negative negative;
    return standing(probe(view, &index, name_hash(name), negative_has_name, name, &negative), &negative, now);
}

enum kest_map_result kest_map_negative_uid(const struct kest_map_view *view, uint32_t uid, int64_t now)
{
    const struct map_index index = negative_index(view, view->header.negative_uids);
    struct kest_map_negative negative;
    return standing(probe(view, &index, kest_map_hash_id(uid), negative_has_uid, &uid, &negative), &negative, now);
}
