#pragma once

#include <QJsonObject>
#include <QList>
#include <QObject>
#include <QSharedPointer>
#include <QStringList>

class GroupListManager;
class HttpHelper;

// One network user as the machine's passwd side sees it.
struct UserEntry {
    uint uid = 0;
    uint gid = 0;
    QString name;
    QString password;
    QString home;
    QString shell;
    QString gecos;
    bool abnormal = false;
};
using UserEntryPtr = QSharedPointer<UserEntry>;

// The network users known on this machine: the specials file, their cache records and their
// local group memberships.
class UserListManager : public QObject
{
    Q_OBJECT

public:
    explicit UserListManager(GroupListManager *groups, QObject *parent = nullptr);

    void loadUsersFromCache();
    void addUser(const QJsonObject &user);
    void saveSpecials(const UserEntryPtr &entry);
    void rebuildUsers(HttpHelper *helper);
    void clearUsers();

    QList<UserEntryPtr> users() const;
    bool hasUserName(const QString &name) const;
    bool hasUid(uint uid) const;
    // 0 when the name is not listed.
    uint uidOfName(const QString &name) const;
    // First entry with this uid, or null.
    UserEntryPtr entryOfUid(uint uid) const;
    // The lower-case hex SHA-256 of the password against the stored digest.
    bool checkOfflinePassword(const QString &name, const QString &password) const;
    // Stamps the user's cache record with the time of an online login.
    void recordLogin(const QString &name);

    static bool isValidDomainAccountName(const QString &name);
    static QString passwordDigest(const QString &password);

private:
    UserEntryPtr findByName(const QString &name) const;
    void appendUser(const UserEntryPtr &entry);
    bool isMarkedForRemoval(uint uid) const;
    void writeCacheRecord(const UserEntry &entry) const;

    GroupListManager *m_groups;
    QList<UserEntryPtr> m_users;
};
