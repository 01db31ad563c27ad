#include "userlistmanager.h"

#include "cachecontrolfactory.h"
#include "cachecontrolinterface.h"
#include "cachestore.h"
#include "grouplistmanager.h"
#include "httphelper.h"
#include "kestpaths.h"
#include "wholefile.h"

#include <QCryptographicHash>
#include <QDateTime>
#include <QDebug>
#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>

#include <cctype>
#include <limits>

namespace
{
const QString shadowedPassword = QStringLiteral("x");

QString stringOf(const QJsonObject &object, const char *key)
{
    return object.value(QLatin1String(key)).toString();
}

uint unsignedOf(const QJsonValue &value)
{
    const double number = value.toDouble();
    return number > 0 && number <= double(std::numeric_limits<uint>::max()) ? uint(number) : 0;
}

QStringList groupsOf(const QJsonObject &user, const QString &primaryGroup)
{
    QStringList groups;
    const QJsonArray permissions = user.value(QLatin1String("permissions")).toArray();
    for (const QJsonValue &permission : permissions)
        groups.append(permission.toString());
    if (!primaryGroup.isEmpty() && !groups.contains(primaryGroup))
        groups.append(primaryGroup);
    return groups;
}

CacheControlPtr loadRecord(uint uid)
{
    CacheControlPtr record = createCacheControl();
    record->setUid(uid);
    if (!loadCacheRecord(record) || record.isNull())
        return CacheControlPtr();
    return record;
}

// The record just loaded answers: loading its file again could only differ while the file is being rewritten.
bool isMarkedForRemoval(const CacheControlInterface &record)
{
    return record.removeStatus() != 0;
}

// A server answer whose user object is missing means the server no longer vouches for the account.
bool userObjectOf(const QString &reply, QJsonObject &user)
{
    const QJsonObject object = QJsonDocument::fromJson(reply.toUtf8()).object();
    if (object.value(QLatin1String("code")).toInt() != 0)
        return false;
    const QJsonValue value = object.value(QLatin1String("data")).toObject().value(QLatin1String("user"));
    if (!value.isObject())
        return false;
    user = value.toObject();
    return true;
}
} // namespace

UserListManager::UserListManager(GroupListManager *groups, QObject *parent)
    : QObject(parent)
    , m_groups(groups)
{
    loadUsersFromCache();
}

void UserListManager::loadUsersFromCache()
{
    const QList<quint32> uids = listCacheUids();
    for (const quint32 uid : uids) {
        const CacheControlPtr record = loadRecord(uid);
        // An unreadable record would enter the passwd side as uid 0 with no name: never list it.
        if (!record || record->uid() != uid || record->account().isEmpty())
            continue;
        if (isMarkedForRemoval(*record))
            continue;
        auto entry = UserEntryPtr::create();
        entry->uid = record->uid();
        entry->gid = record->mainGid();
        entry->name = record->account();
        entry->password = record->password();
        entry->home = record->homePath();
        entry->shell = record->loginShell();
        entry->gecos = record->gecos();
        appendUser(entry);
    }
}

void UserListManager::appendUser(const UserEntryPtr &entry)
{
    m_users.append(entry);
    if (!m_byName.contains(entry->name))
        m_byName.insert(entry->name, entry);
    if (!m_byUid.contains(entry->uid))
        m_byUid.insert(entry->uid, entry);
    if (!isValidDomainAccountName(entry->name))
        m_specials.append(entry);
}

UserListManager::Added UserListManager::addUser(const QJsonObject &user)
{
    auto incoming = UserEntryPtr::create();
    incoming->name = stringOf(user, "name");
    incoming->password = stringOf(user, "password");
    incoming->uid = unsignedOf(user.value(QLatin1String("uid")));
    const QJsonObject primary = user.value(QLatin1String("primary_group")).toObject();
    incoming->gid = unsignedOf(primary.value(QLatin1String("id")));
    QStringList groups = groupsOf(user, stringOf(primary, "name"));
    incoming->gecos = stringOf(user, "gecos");
    incoming->home = stringOf(user, "home");
    incoming->shell = stringOf(user, "shell");
    if (incoming->home.isEmpty())
        incoming->home = QStringLiteral("/home/") + incoming->name;
    if (incoming->shell.isEmpty())
        incoming->shell = QStringLiteral("/bin/bash");

    UserEntryPtr entry = findByName(incoming->name);
    // A uid that moved, or that another listed account holds, would hand one account's files to another.
    const UserEntryPtr holder = m_byUid.value(incoming->uid);
    if ((entry && entry->uid != incoming->uid) || (holder && holder->name != incoming->name)) {
        qCritical().noquote() << QStringLiteral(
            "critical error: the same username has different UID. system refused login.");
        return Added::Refused;
    }
    if (entry && entry->gid != incoming->gid) {
        const QString groupName = m_groups ? m_groups->systemGroupName(incoming->gid) : QString();
        if (!groupName.isEmpty() && !groups.contains(groupName))
            groups.append(groupName);
    }

    // A look-up carries only the shadow marker: it must not wipe the digest of the last login.
    if (incoming->password == shadowedPassword) {
        if (entry && !entry->password.isEmpty())
            incoming->password = entry->password;
        else if (const CacheControlPtr record = loadRecord(incoming->uid))
            incoming->password = record->password().isEmpty() ? shadowedPassword : record->password();
    }

    if (entry) {
        *entry = *incoming;
    } else {
        entry = incoming;
        appendUser(entry);
    }
    bool saved = saveSpecials(entry);
    if (m_groups) {
        for (const QString &group : qAsConst(groups))
            m_groups->addUserToGroup(group, entry->name);
        saved = m_groups->saveGroups() && saved;
    }
    return saved ? Added::Written : Added::NotWritten;
}

bool UserListManager::saveSpecials(const UserEntryPtr &entry)
{
    QString text;
    for (const UserEntryPtr &user : qAsConst(m_specials))
        text += QStringLiteral("%1:%2:%3:%4:%5:%6:%7\n")
                    .arg(user->name, shadowedPassword, QString::number(user->uid), QString::number(user->gid),
                        user->gecos, user->home, user->shell);
    QString error;
    const bool listed = WholeFile::write(KestPaths::specialsFile(), text.toUtf8(),
        QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ReadGroup | QFileDevice::ReadOther, error);
    if (!listed)
        qWarning().noquote() << QStringLiteral("open specials file failed. ") + error;

    if (!entry)
        return listed;
    if (!isValidDomainAccountName(entry->name)) {
        qWarning().noquote() << QStringLiteral("invalid domain account name.");
        return listed;
    }
    return writeCacheRecord(*entry) && listed;
}

bool UserListManager::writeCacheRecord(const UserEntry &entry) const
{
    CacheControlPtr record = createCacheControl();
    record->setVersion(kCacheVersion1_0);
    record->setUid(entry.uid);
    record->setAccount(entry.name);
    record->setPassword(entry.password);
    record->setMainGid(entry.gid);
    record->setGecos(entry.gecos);
    record->setHomePath(entry.home);
    record->setLoginShell(entry.shell);
    // The offline-login window runs from the last online login, which a refresh must not reset.
    const CacheControlPtr previous = loadRecord(entry.uid);
    if (previous) {
        record->setLastLoginTime(previous->lastLoginTime());
        // Only deleting the record clears its removal mark.
        record->setRemoveStatus(previous->removeStatus());
        if (previous->toJsonString(QJsonDocument::Compact) == record->toJsonString(QJsonDocument::Compact))
            return true;
    }
    return saveCacheRecord(*record);
}

bool UserListManager::recordLogin(const QString &name)
{
    const UserEntryPtr entry = findByName(name);
    if (!entry)
        return false;
    const CacheControlPtr record = loadRecord(entry->uid);
    if (!record)
        return false;
    record->setLastLoginTime(quint64(QDateTime::currentSecsSinceEpoch()));
    return saveCacheRecord(*record);
}

void UserListManager::rebuildUsers(HttpHelper *helper)
{
    QString hostPort;
    if (!helper || !helper->checkServerAddress(hostPort))
        return;

    const QList<UserEntryPtr> previous = m_users;
    clearUsers();
    if (m_groups)
        m_groups->removeDomainMembers();

    for (const UserEntryPtr &entry : previous) {
        if (!isValidDomainAccountName(entry->name))
            continue;
        const QString reply = helper->queryUserByName(entry->name);
        const bool lost = reply == HttpHelper::unreachableReply()
            || (reply == HttpHelper::refusedReply() && !helper->lastRequestAnswered());
        if (lost) {
            // Lost the server half-way (no connection, or no answer on it): keep what is known rather than
            // dropping the account.
            appendUser(entry);
            continue;
        }
        QJsonObject user;
        if (reply == HttpHelper::unknownAccountReply() || reply == HttpHelper::refusedReply()
            || !userObjectOf(reply, user)) {
            qInfo().noquote() << QStringLiteral("abnormal user, remove cache now. user: ") + entry->name;
            removeCacheFile(entry->uid);
            continue;
        }
        addUser(user);
    }
}

void UserListManager::clearUsers()
{
    m_users.clear();
    m_byName.clear();
    m_byUid.clear();
    m_specials.clear();
}

QList<UserEntryPtr> UserListManager::users() const
{
    return m_users;
}

UserEntryPtr UserListManager::findByName(const QString &name) const
{
    return m_byName.value(name);
}

bool UserListManager::hasUserName(const QString &name) const
{
    return !findByName(name).isNull();
}

bool UserListManager::hasUid(uint uid) const
{
    return !entryOfUid(uid).isNull();
}

uint UserListManager::uidOfName(const QString &name) const
{
    const UserEntryPtr entry = findByName(name);
    return entry ? entry->uid : 0;
}

UserEntryPtr UserListManager::entryOfUid(uint uid) const
{
    return m_byUid.value(uid);
}

bool UserListManager::checkOfflinePassword(const QString &name, const QString &password) const
{
    const UserEntryPtr entry = findByName(name);
    return entry && entry->password == passwordDigest(password);
}

bool UserListManager::isValidDomainAccountName(const QString &name)
{
    const QVector<uint> characters = name.toUcs4();
    if (characters.size() < 2)
        return false;
    for (const uint character : characters) {
        const bool ascii = character < 128;
        if (ascii) {
            const char c = char(character);
            if (!std::isalnum(static_cast<unsigned char>(c)) && c != '@' && c != '-' && c != '_')
                return false;
        } else if (!QChar::isLetter(character) && !QChar::isDigit(character)) {
            return false;
        }
    }
    return true;
}

QString UserListManager::passwordDigest(const QString &password)
{
    return QString::fromLatin1(QCryptographicHash::hash(password.toUtf8(), QCryptographicHash::Sha256).toHex());
}
