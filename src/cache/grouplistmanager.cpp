#include "grouplistmanager.h"

#include "cache-common.h"
#include "common.h"
#include "kestpaths.h"
#include "wholefile.h"

#include <QDebug>
#include <QFile>
#include <QSet>
#include <QTextStream>

#include <dlfcn.h>
#include <grp.h>
#include <nss.h>

namespace
{
using GetGrNam = enum nss_status (*)(const char *, struct group *, char *, size_t, int *);
using GetGrGid = enum nss_status (*)(gid_t, struct group *, char *, size_t, int *);

const int lookupBufferSize = 8192;
const uint firstFreeGid = 5000;
const uint lastFreeGid = 9999;
const uint kestGid = 10000;
const QString kestGroup = QStringLiteral("kest");
const QString placeholderName = QStringLiteral("x");

void fillFromSystem(const struct group &record, GroupEntry &entry)
{
    entry.gid = record.gr_gid;
    entry.name = QString::fromUtf8(record.gr_name);
    entry.password = QString::fromUtf8(record.gr_passwd ? record.gr_passwd : "");
    entry.members.clear();
    for (char **member = record.gr_mem; member && *member; ++member)
        entry.members.append(QString::fromUtf8(*member));
}
} // namespace

GroupListManager::GroupListManager(QObject *parent)
    : QObject(parent)
{
    dlerror();
    m_library = load_nss_library("files", nullptr, nss_function_table);
    nss_library_handle = m_library;
    if (!m_library) {
        const char *error = dlerror();
        log_message(3, "src/cache/grouplistmanager", 213, "GroupListManager::GroupListManager(QObject*)",
            "load compat library failed. error: %s", error ? error : "");
        return;
    }
    loadGroups();
    const char *const standardGroups[] = { "sudo", "lp", "lpadmin", "dialout", "scanner", "kest" };
    for (const char *group : standardGroups)
        addGroupMember(QString::fromLatin1(group), QString());
}

GroupListManager::~GroupListManager()
{
    // Each manager closes the load it made itself, so one manager's end never unloads the module
    // under another one that is still using the shared function table.
    if (m_library)
        dlclose(m_library);
}

void GroupListManager::loadGroups()
{
    QFile file(KestPaths::groupsFile());
    if (!file.open(QIODevice::ReadOnly | QIODevice::Text)) {
        qWarning().noquote() << QStringLiteral("cannot read groups file. ");
        return;
    }
    QTextStream stream(&file);
    stream.setCodec("UTF-8");
    while (!stream.atEnd()) {
        const QString line = stream.readLine();
        const QStringList fields = line.split(QLatin1Char(':'));
        if (fields.size() < 4) {
            qWarning().noquote() << QStringLiteral("invalid groups line: ") + line;
            continue;
        }
        auto entry = GroupEntryPtr::create();
        entry->name = fields.at(0);
        entry->password = fields.at(1);
        entry->gid = fields.at(2).toUInt();
        // The writer leaves a trailing comma on short member texts; an empty part names nobody.
        const QStringList members = fields.at(3).split(QLatin1Char(','));
        for (const QString &member : members) {
            if (!member.isEmpty() && !entry->members.contains(member))
                entry->members.append(member);
        }
        m_groups.append(entry);
    }
}

bool GroupListManager::saveGroups()
{
    QString text;
    for (const GroupEntryPtr &entry : qAsConst(m_groups)) {
        if (entry->name.isEmpty() || entry->name == placeholderName)
            continue;
        QString members;
        for (const QString &member : qAsConst(entry->members))
            members += member + QLatin1Char(',');
        // Short member texts keep their trailing comma: name-service readers split keeping empty parts.
        if (members.size() > 6)
            members.chop(1);
        text += QStringLiteral("%1:%2:%3:%4\n").arg(entry->name, entry->password, QString::number(entry->gid), members);
    }
    QString error;
    if (!WholeFile::write(KestPaths::groupsFile(), text.toUtf8(),
            QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ReadGroup | QFileDevice::ReadOther,
            error)) {
        qWarning().noquote() << QStringLiteral("cannot write groups file. ");
        return false;
    }
    return true;
}

bool GroupListManager::lookupSystemGroup(const QString &name, GroupEntry &entry) const
{
    auto getgrnam = reinterpret_cast<GetGrNam>(nss_function_table[NSS_GETGRNAM_R].function);
    if (!m_library || !getgrnam)
        return false;
    struct group record;
    char buffer[lookupBufferSize];
    int error = 0;
    const QByteArray encoded = name.toUtf8();
    if (getgrnam(encoded.constData(), &record, buffer, sizeof(buffer), &error) < NSS_STATUS_SUCCESS)
        return false;
    fillFromSystem(record, entry);
    return true;
}

QString GroupListManager::systemGroupName(uint gid) const
{
    auto getgrgid = reinterpret_cast<GetGrGid>(nss_function_table[NSS_GETGRGID_R].function);
    if (!m_library || !getgrgid)
        return QString();
    struct group record;
    char buffer[lookupBufferSize];
    int error = 0;
    if (getgrgid(gid, &record, buffer, sizeof(buffer), &error) < NSS_STATUS_SUCCESS)
        return QString();
    return QString::fromUtf8(record.gr_name);
}

void GroupListManager::addGroupMember(const QString &name, const QString &user)
{
    GroupEntry system;
    const bool known = lookupSystemGroup(name, system);

    GroupEntryPtr entry = findGroup(name);
    const bool created = entry.isNull();
    // Without a number of its own a new group would share another one's: it is not made at all.
    const uint gid = created && !known && name != kestGroup ? nextFreeGid() : 0;
    if (created && !known && name != kestGroup && gid == 0) {
        qWarning().noquote() << QStringLiteral("no free group id for group: ") + name;
        return;
    }
    if (created) {
        entry = GroupEntryPtr::create();
        m_groups.append(entry);
    }

    if (known) {
        entry->gid = system.gid;
        entry->name = system.name;
        entry->password = system.password;
        for (const QString &member : qAsConst(system.members)) {
            if (!entry->members.contains(member))
                entry->members.append(member);
        }
    } else {
        // A group already in the file keeps its number: files on disk may carry it.
        if (created || entry->gid == 0)
            entry->gid = name == kestGroup ? kestGid : gid ? gid : nextFreeGid();
        entry->name = name;
        entry->password = placeholderName;
    }

    if (!user.isEmpty() && !entry->members.contains(user))
        entry->members.append(user);
}

void GroupListManager::addUserToGroup(const QString &name, const QString &user)
{
    if (name == placeholderName)
        return;
    addGroupMember(name, user);
}

void GroupListManager::removeGroupMember(const QString &name, const QString &user)
{
    const GroupEntryPtr entry = findGroup(name);
    if (!entry || !entry->members.contains(user))
        return;
    entry->members.removeAll(user);
    saveGroups();
}

void GroupListManager::removeUserFromGroups(const QString &user)
{
    for (const GroupEntryPtr &entry : qAsConst(m_groups))
        entry->members.removeAll(user);
}

void GroupListManager::removeDomainMembers()
{
    for (const GroupEntryPtr &entry : qAsConst(m_groups)) {
        entry->members.erase(std::remove_if(entry->members.begin(), entry->members.end(),
                                 [](const QString &member) { return member.startsWith(QLatin1Char('@')); }),
            entry->members.end());
    }
    saveGroups();
}

QStringList GroupListManager::groupsOfUser(const QString &user) const
{
    QStringList result;
    for (const GroupEntryPtr &entry : m_groups) {
        if (entry->name == placeholderName)
            continue;
        qDebug() << "current group: " << entry->name << ", member list" << entry->members;
        if (entry->members.contains(user) && !result.contains(entry->name))
            result.append(entry->name);
    }
    return result;
}

uint GroupListManager::nextFreeGid() const
{
    QSet<uint> used;
    for (const GroupEntryPtr &entry : m_groups)
        used.insert(entry->gid);
    for (uint candidate = firstFreeGid; candidate <= lastFreeGid; ++candidate) {
        if (!used.contains(candidate) && systemGroupName(candidate).isEmpty())
            return candidate;
    }
    return 0;
}

QList<GroupEntryPtr> GroupListManager::groups() const
{
    return m_groups;
}

GroupEntryPtr GroupListManager::findGroup(const QString &name) const
{
    for (const GroupEntryPtr &entry : m_groups) {
        if (entry->name == name)
            return entry;
    }
    return GroupEntryPtr();
}
