#pragma once

#include <QJsonObject>
#include <QObject>
#include <QString>

#include <memory>

class GroupListManager;
class HttpHelper;
class UserListManager;
struct KestCacheWorkerState;

// The cache daemon's engine: account look-ups, password checks and password changes against the
// domain server, with the local account files and cache records as the offline fallback.
class KestCacheService : public QObject
{
    Q_OBJECT

public:
    explicit KestCacheService(QObject *parent = nullptr);
    ~KestCacheService() override;

    // Not reachable through any request: the server commands go through modifyUser.
    QString changePassword(const QString &userName, const QString &newPassword, const QString &oldPassword);

    UserListManager *userList() const;

    static QString passReply(bool pass);

Q_SIGNALS:
    void updateCache();

public Q_SLOTS:
    QString queryAccountName(QString name);
    QString queryUid(uint uid);
    QString queryGroupName(QString name, QString baseJson);
    QString queryGid(uint gid, QString baseJson);
    QString authenticatePassword(QString username, QString password);
    QString modifyUser(QString json);
    // Entries for the name-service module, from the cache records alone; never a password.
    QString getAccountByName(QString name);
    QString getAccountByUid(uint uid);
    QString listAccounts();
    void onUpdateCache();

private:
    static void waitForServer(KestCacheService *service, std::shared_ptr<KestCacheWorkerState> state);
    static bool validateServerAnswer(const QString &reply, const QString &password, QJsonObject &user);
    static QString statusReply(int code, const QString &message);
    QString answerLookup(
        const QString &reply, bool known, const QString &offlineMessage, const QString &unknownMessage);
    bool isEnabled() const;

    std::unique_ptr<HttpHelper> m_http;
    std::unique_ptr<GroupListManager> m_groups;
    std::unique_ptr<UserListManager> m_users;
    std::shared_ptr<KestCacheWorkerState> m_worker;
};
