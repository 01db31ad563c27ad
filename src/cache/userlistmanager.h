#pragma once

#include <QHash>
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
    // NotWritten when a file could not be replaced (each failure is logged where it happens); Refused,
    // with nothing changed, when the name or the uid is listed with another uid or name.
    enum class Added { Written, NotWritten, Refused };
    Added addUser(const QJsonObject &user);
    bool saveSpecials(const UserEntryPtr &entry);
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
    bool recordLogin(const QString &name);

    static bool isValidDomainAccountName(const QString &name);
    static QString passwordDigest(const QString &password);

private:
    UserEntryPtr findByName(const QString &name) const;
    void appendUser(const UserEntryPtr &entry);
    bool writeCacheRecord(const UserEntry &entry) const;

    GroupListManager *m_groups;
    QList<UserEntryPtr> m_users;
    // The first entry of each name and uid in list order, so that a look-up answers as a walk of the list
    // would. A listed entry never changes its name or uid, which keeps both valid until the list is emptied.
    QHash<QString, UserEntryPtr> m_byName;
    QHash<uint, UserEntryPtr> m_byUid;
    // The entries the specials file lists, in list order.
    QList<UserEntryPtr> m_specials;
};
