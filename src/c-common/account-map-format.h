/* account-map-format.h - the layout of the account map that cache-kest publishes for the name-service module */
#ifndef KEST_ACCOUNT_MAP_FORMAT_H
#define KEST_ACCOUNT_MAP_FORMAT_H

#include <stddef.h>
#include <stdint.h>

/* One block of 32-bit words in the machine's own byte order, read in place through a mapping: a header,
 * record tables, open-addressing hash indexes and one string area. Every offset counts from the start of
 * the file and is a multiple of 4; a text is an offset and a length into the string area. An index has a
 * power-of-two number of slots, each 0 (empty) or a record number plus 1; a key's probe starts at its hash
 * and walks on one slot at a time. No password or digest is ever written here: the file is world-readable. */

#define KEST_MAP_MAGIC "kestmap2"
#define KEST_MAP_MAGIC_SIZE 8
/* Written as a number: a map of the other byte order reads differently and is refused. */
#define KEST_MAP_BYTE_ORDER 0x01020304u
/* Far above 10,000 accounts; a larger file is not mapped. */
#define KEST_MAP_SIZE_LIMIT (64u * 1024u * 1024u)

struct kest_map_text {
    uint32_t offset; /* into the string area */
    uint32_t length;
};

/* An account as the daemon's account entries give it: by name and by uid (each index lists the accounts
 * that look-up would answer, which need not be the same ones). */
struct kest_map_account {
    uint32_t uid;
    uint32_t gid;
    struct kest_map_text name, gecos, home, shell;
};

/* A name listed as a member in the group list, with the gids of the lines that list it, in file order. */
struct kest_map_member {
    struct kest_map_text name;
    uint32_t first_id; /* into the id area */
    uint32_t id_count;
};

/* A line of the group list: its members are member record numbers in the id area. */
struct kest_map_group {
    uint32_t gid;
    struct kest_map_text name, password;
    uint32_t first_id;
    uint32_t id_count;
};

/* A name or uid the domain server said does not exist: "not found" until the second since the epoch until
 * (exclusive), while the daemon that wrote the map still runs. An entry by name has uid 0, one by uid an
 * empty name; its text lies in the negative string area. */
struct kest_map_negative {
    struct kest_map_text name;
    uint32_t uid;
    uint32_t reserved;
    int64_t until;
};

struct kest_map_header {
    char magic[KEST_MAP_MAGIC_SIZE];
    uint32_t byte_order;
    uint32_t size; /* of the whole file */
    uint32_t account_count, account_slots, accounts, account_names, account_uids;
    uint32_t member_count, member_slots, members, member_names;
    uint32_t group_count, group_slots, groups, group_names, group_gids;
    uint32_t id_count, ids;
    uint32_t string_size, strings;
    /* Last in the file, so that new negative answers replace this part alone. */
    uint32_t daemon_pid;
    uint32_t negative_count, negative_slots, negatives, negative_names, negative_uids;
    uint32_t negative_string_size, negative_strings;
};

/* FNV-1a: the same on both sides, cheap for short names. */
static inline uint32_t kest_map_hash_text(const char *text, size_t length)
{
    uint32_t hash = 2166136261u;
    for (size_t i = 0; i < length; ++i) {
        hash ^= (unsigned char)text[i];
        hash *= 16777619u;
    }
    return hash;
}

/* Network ids are mostly consecutive: a multiplicative hash spreads them over the slots. */
static inline uint32_t kest_map_hash_id(uint32_t id)
{
    return id * 2654435761u;
}

#endif
