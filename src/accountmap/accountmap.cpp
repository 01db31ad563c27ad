#include "accountmap.h"

#include "account-map-format.h"

#include <QHash>
#include <QSet>

#include <cstring>

namespace
{
using Index = QVector<quint32>;

quint32 slotsFor(int count)
{
    quint32 slots = 1;
    // At most half full: a miss ends at an empty slot after a probe or two.
    while (slots < quint32(count) * 2)
        slots *= 2;
    return slots;
}

void insert(Index &index, quint32 hash, int record)
{
    const quint32 mask = quint32(index.size()) - 1;
    quint32 slot = hash & mask;
    while (index[int(slot)] != 0)
        slot = (slot + 1) & mask;
    index[int(slot)] = quint32(record) + 1;
}

quint32 textHash(const QByteArray &text)
{
    return kest_map_hash_text(text.constData(), size_t(text.size()));
}

bool parseGid(const QByteArray &text, quint32 &gid)
{
    if (text.isEmpty() || text.size() > 10)
        return false;
    quint64 value = 0;
    for (const char c : text) {
        if (c < '0' || c > '9')
            return false;
        value = value * 10 + quint64(c - '0');
    }
    if (value == 0 || value > 0xffffffffu)
        return false;
    gid = quint32(value);
    return true;
}

// Appends words and texts; offsets of the whole file are set once every part's size is known.
class Block
{
public:
    kest_map_text text(const QByteArray &bytes)
    {
        const kest_map_text text { quint32(m_strings.size()), quint32(bytes.size()) };
        m_strings += bytes;
        m_strings += '\0';
        return text;
    }
    QByteArray strings() const { return m_strings; }

private:
    QByteArray m_strings;
};

template<typename T> void appendRaw(QByteArray &out, const T *data, int count)
{
    out.append(reinterpret_cast<const char *>(data), int(sizeof(T)) * count);
}
} // namespace

void AccountMap::addAccount(const Account &account, bool byName)
{
    m_accounts.append(account);
    m_byName.append(byName);
}

void AccountMap::setGroupList(const QByteArray &text)
{
    m_groups.clear();
    const QList<QByteArray> lines = text.split('\n');
    for (const QByteArray &line : lines) {
        const QList<QByteArray> fields = line.split(':');
        Group group;
        if (fields.size() < 4 || !parseGid(fields.at(2), group.gid))
            continue;
        group.name = fields.at(0);
        group.password = fields.at(1);
        for (const QByteArray &member : fields.at(3).split(',')) {
            if (!member.isEmpty())
                group.members.append(member);
        }
        m_groups.append(group);
    }
}

QByteArray AccountMap::toBytes() const
{
    Block block;
    kest_map_header header {};
    memcpy(header.magic, KEST_MAP_MAGIC, KEST_MAP_MAGIC_SIZE);
    header.byte_order = KEST_MAP_BYTE_ORDER;

    QVector<kest_map_account> accounts;
    header.account_count = quint32(m_accounts.size());
    header.account_slots = slotsFor(m_accounts.size());
    Index accountNames(int(header.account_slots)), accountUids(int(header.account_slots));
    QSet<QByteArray> names;
    QSet<quint32> uids;
    for (int i = 0; i < m_accounts.size(); ++i) {
        const Account &account = m_accounts.at(i);
        accounts.append({ account.uid, account.gid, block.text(account.name), block.text(account.gecos),
            block.text(account.home), block.text(account.shell) });
        if (m_byName.at(i) && !names.contains(account.name)) {
            names.insert(account.name);
            insert(accountNames, textHash(account.name), i);
        }
        if (!uids.contains(account.uid)) {
            uids.insert(account.uid);
            insert(accountUids, kest_map_hash_id(account.uid), i);
        }
    }

    // Every name a line lists, with the gids of the lines that list it; a group's members point at them.
    QVector<kest_map_member> members;
    QList<QList<quint32>> gidsOfMember;
    QHash<QByteArray, int> memberNumber;
    QVector<kest_map_group> groups;
    QList<QList<quint32>> membersOfGroup;
    header.group_count = quint32(m_groups.size());
    header.group_slots = slotsFor(m_groups.size());
    Index groupNames(int(header.group_slots)), groupGids(int(header.group_slots));
    QSet<QByteArray> groupNameSeen;
    QSet<quint32> gidSeen;
    for (int i = 0; i < m_groups.size(); ++i) {
        const Group &group = m_groups.at(i);
        QList<quint32> numbers;
        for (const QByteArray &member : group.members) {
            auto found = memberNumber.constFind(member);
            if (found == memberNumber.cend()) {
                found = memberNumber.insert(member, members.size());
                members.append({ block.text(member), 0, 0 });
                gidsOfMember.append(QList<quint32>());
            }
            numbers.append(quint32(*found));
            if (!gidsOfMember[*found].contains(group.gid))
                gidsOfMember[*found].append(group.gid);
        }
        groups.append({ group.gid, block.text(group.name), block.text(group.password), 0, 0 });
        membersOfGroup.append(numbers);
        if (!groupNameSeen.contains(group.name)) {
            groupNameSeen.insert(group.name);
            insert(groupNames, textHash(group.name), i);
        }
        if (!gidSeen.contains(group.gid)) {
            gidSeen.insert(group.gid);
            insert(groupGids, kest_map_hash_id(group.gid), i);
        }
    }
    header.member_count = quint32(members.size());
    header.member_slots = slotsFor(members.size());
    Index memberNames(int(header.member_slots));
    QVector<quint32> ids;
    for (int i = 0; i < members.size(); ++i) {
        members[i].first_id = quint32(ids.size());
        members[i].id_count = quint32(gidsOfMember.at(i).size());
        ids += gidsOfMember.at(i).toVector();
        const QByteArray name = block.strings().mid(int(members.at(i).name.offset), int(members.at(i).name.length));
        insert(memberNames, textHash(name), i);
    }
    for (int i = 0; i < groups.size(); ++i) {
        groups[i].first_id = quint32(ids.size());
        groups[i].id_count = quint32(membersOfGroup.at(i).size());
        ids += membersOfGroup.at(i).toVector();
    }

    const QByteArray strings = block.strings();
    quint32 at = sizeof(header);
    const auto place = [&at](quint32 &field, quint32 bytes) {
        field = at;
        at += bytes;
    };
    place(header.accounts, header.account_count * sizeof(kest_map_account));
    place(header.account_names, header.account_slots * 4);
    place(header.account_uids, header.account_slots * 4);
    place(header.members, header.member_count * sizeof(kest_map_member));
    place(header.member_names, header.member_slots * 4);
    place(header.groups, header.group_count * sizeof(kest_map_group));
    place(header.group_names, header.group_slots * 4);
    place(header.group_gids, header.group_slots * 4);
    header.id_count = quint32(ids.size());
    place(header.ids, header.id_count * 4);
    header.string_size = quint32(strings.size());
    place(header.strings, (header.string_size + 3) / 4 * 4);
    header.size = at;

    QByteArray out;
    out.reserve(int(at));
    appendRaw(out, &header, 1);
    appendRaw(out, accounts.constData(), accounts.size());
    appendRaw(out, accountNames.constData(), accountNames.size());
    appendRaw(out, accountUids.constData(), accountUids.size());
    appendRaw(out, members.constData(), members.size());
    appendRaw(out, memberNames.constData(), memberNames.size());
    appendRaw(out, groups.constData(), groups.size());
    appendRaw(out, groupNames.constData(), groupNames.size());
    appendRaw(out, groupGids.constData(), groupGids.size());
    appendRaw(out, ids.constData(), ids.size());
    out += strings;
    out.append(int(at) - out.size(), '\0');
    return withNegativeAnswers(out, {}, 0);
}

QByteArray AccountMap::withNegativeAnswers(
    const QByteArray &bytes, const QList<NegativeAnswer> &answers, quint32 daemonPid)
{
    kest_map_header header;
    if (bytes.size() < int(sizeof(header)))
        return QByteArray();
    memcpy(&header, bytes.constData(), sizeof(header));
    // The accounts and groups end where the strings do; whatever followed them is replaced.
    const quint32 at = header.strings + (header.string_size + 3) / 4 * 4;
    if (at > quint32(bytes.size()))
        return QByteArray();
    Block block;
    QVector<kest_map_negative> negatives;
    header.daemon_pid = daemonPid;
    header.negative_count = quint32(answers.size());
    header.negative_slots = slotsFor(answers.size());
    Index names(int(header.negative_slots)), uids(int(header.negative_slots));
    for (int i = 0; i < answers.size(); ++i) {
        const NegativeAnswer &answer = answers.at(i);
        negatives.append({ block.text(answer.name), answer.uid, 0, answer.until });
        if (answer.name.isEmpty())
            insert(uids, kest_map_hash_id(answer.uid), i);
        else
            insert(names, textHash(answer.name), i);
    }
    const QByteArray strings = block.strings();
    header.negatives = at;
    header.negative_names = header.negatives + header.negative_count * sizeof(kest_map_negative);
    header.negative_uids = header.negative_names + header.negative_slots * 4;
    header.negative_strings = header.negative_uids + header.negative_slots * 4;
    header.negative_string_size = quint32(strings.size());
    header.size = header.negative_strings + (header.negative_string_size + 3) / 4 * 4;

    QByteArray out;
    out.reserve(int(header.size));
    appendRaw(out, &header, 1);
    out.append(bytes.constData() + sizeof(header), int(at - sizeof(header)));
    appendRaw(out, negatives.constData(), negatives.size());
    appendRaw(out, names.constData(), names.size());
    appendRaw(out, uids.constData(), uids.size());
    out += strings;
    out.append(int(header.size) - out.size(), '\0');
    return out;
}
