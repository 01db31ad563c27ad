#pragma once

#include "negativeanswers.h"
#include "serverreachability.h"

#include <QJsonObject>
#include <QObject>
#include <QString>

#include <atomic>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <thread>

class GroupListManager;
class HttpHelper;
class LoginThrottle;
class ServerReachability;
class UserListManager;

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
    NegativeAnswers *negativeAnswers() { return &m_unknown; }
    LoginThrottle *loginThrottle() const;

    // The update worker runs only while the daemon listens, and is stopped before anything it uses
    // is torn down.
    void startWorker();
    void stopWorker();

    // All the network time one function call may take, so that callers waiting 5 s always get an answer.
    static const int callNetworkBudgetMs = 4000;

    // What the status command shows: the server as the requests and the probe found it, when the local
    // users were last refreshed from it, when this daemon started (seconds since the epoch, 0: never).
    ServerReachability::Snapshot serverState() const;
    qint64 lastRefresh() const { return m_lastRefresh.load(); }
    qint64 startedAt() const { return m_startedAt; }

    static QString passReply(bool pass);
    // Takes the user object out of a server answer and puts the password's digest (or "x") in it.
    static bool validateServerAnswer(const QString &reply, const QString &password, QJsonObject &user);

Q_SIGNALS:
    void updateCache();
    // A cache record or the group list was written: the account map is to show it before the reply goes.
    void accountsWritten();
    // An answer "no such account" began or ended other than by a written account.
    void negativeAnswersChanged();

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
    void watchServer();
    bool sleepUnlessStopped();
    void beginCall();
    static QString statusReply(int code, const QString &message);
    // {"pass":false} with the seconds the account stays locked.
    static QString lockedReply(qint64 until);
    QString checkPassword(const QString &username, const QString &password, uint uid);
    QString answerLookup(
        const QString &reply, bool known, const QString &offlineMessage, const QString &unknownMessage);
    bool isEnabled() const;

    std::shared_ptr<ServerReachability> m_reachability;
    std::unique_ptr<HttpHelper> m_http;
    std::unique_ptr<GroupListManager> m_groups;
    std::unique_ptr<UserListManager> m_users;
    std::unique_ptr<LoginThrottle> m_throttle;
    std::thread m_worker;
    std::mutex m_workerMutex;
    std::condition_variable m_workerWake;
    std::atomic<bool> m_stopWorker { false };
    std::atomic<qint64> m_lastRefresh { 0 };
    qint64 m_startedAt;
    NegativeAnswers m_unknown;
};
