// Fuzz target: the account map as the name-service module reads it, whatever the file holds. The header's
// fixed fields are made to match, so that the fuzzer reaches the tables, indexes and texts behind them.
extern "C" {
#include "account-map.h"
}

#include <cstring>
#include <vector>

namespace
{
void readAll(const kest_map_view &view, const kest_map_account &account)
{
    for (const struct kest_map_text &text : { account.name, account.gecos, account.home, account.shell }) {
        if (const char *bytes = kest_map_text(&view, text))
            (void)std::memchr(bytes, 0, text.length);
    }
}

void lookUp(const kest_map_view &view)
{
    kest_map_account account;
    if (kest_map_account_by_name(&view, "@alice", &account) == KEST_MAP_FOUND)
        readAll(view, account);
    if (kest_map_account_by_uid(&view, 10002, &account) == KEST_MAP_FOUND)
        readAll(view, account);
    // At a fixed instant, so that a finding replays the same way.
    const int64_t now = 1500000000;
    kest_map_negative_name(&view, "@carol", now);
    kest_map_negative_uid(&view, 10099, now);
    kest_map_member member;
    uint32_t id;
    if (kest_map_member_by_name(&view, "@alice", &member) == KEST_MAP_FOUND) {
        for (uint32_t i = 0; i < member.id_count && kest_map_id(&view, member.first_id, i, &id); ++i) { }
    }
    kest_map_group group;
    if (kest_map_group_by_name(&view, "kest", &group) != KEST_MAP_FOUND
        && kest_map_group_by_gid(&view, 27, &group) != KEST_MAP_FOUND)
        return;
    kest_map_text(&view, group.name);
    for (uint32_t i = 0; i < group.id_count && kest_map_id(&view, group.first_id, i, &id); ++i) {
        if (kest_map_member_at(&view, id, &member) == KEST_MAP_FOUND)
            kest_map_text(&view, member.name);
    }
}
} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    // Exactly the input's bytes, so that a read past them is caught.
    std::vector<uint8_t> bytes(data, data + size);
    kest_map_view view;
    if (kest_map_view_init(&view, bytes.data(), bytes.size()))
        lookUp(view);
    if (size < sizeof(kest_map_header))
        return 0;
    kest_map_header header;
    std::memcpy(&header, bytes.data(), sizeof(header));
    std::memcpy(header.magic, KEST_MAP_MAGIC, KEST_MAP_MAGIC_SIZE);
    header.byte_order = KEST_MAP_BYTE_ORDER;
    header.size = uint32_t(size);
    std::memcpy(bytes.data(), &header, sizeof(header));
    if (kest_map_view_init(&view, bytes.data(), bytes.size()))
        lookUp(view);
    return 0;
}
