#include "kestcacheservice.h"

#include "cachestore.h"
#include "compactjson.h"
#include "globalsetting.h"
#include "grouplistmanager.h"
#include "homedirectoryrepair.h"
#include "httphelper.h"
#include "loginthrottle.h"
#include "offlinelogin.h"
#include "serverreachability.h"
#include "userlistmanager.h"

#include <QDateTime>
#include <QDebug>
#include <QJsonDocument>
#include <QThread>

#include <algorithm>
#include <chrono>
#include <limits>

namespace
{
const QString shadowedPassword = QStringLiteral("x");
const uint firstDomainUid = 10000;

QString threadId()
{
    return QString::number(reinterpret_cast<quintptr>(QThread::currentThreadId()));
}

// The record of a network account that the machine may show: readable, of a domain uid, not marked for removal.
CacheControlPtr shownAccount(uint uid)
{
    if (uid < firstDomainUid)
        return CacheControlPtr();
    const CacheControlPtr record = readCacheRecord(uid);
    if (!record || record->uid() != uid || record->account().isEmpty() || record->removeStatus() != 0)
        return CacheControlPtr();
    return record;
}

// Keys in the order the document writer sorts them.
void appendAccountEntry(QByteArray &out, const CacheControlInterface &record)
{
    out += "{\"gecos\":";
    CompactJson::append(out, record.gecos());
    out += ",\"gid\":" + QByteArray::number(record.mainGid()) + ",\"home\":";
    CompactJson::append(out, record.homePath());
    out += ",\"name\":";
    CompactJson::append(out, record.account());
    out += ",\"shell\":";
    CompactJson::append(out, record.loginShell());
    out += ",\"uid\":" + QByteArray::number(record.uid()) + '}';
}

// The server's own "no such account": the fixed text, or an answer of the server's with a failure code and
// no user. Refusals and outages are never taken for it.
bool saysUnknown(const QString &reply)
{
    if (reply == HttpHelper::unknownAccountReply())
        return true;
    if (reply == HttpHelper::unreachableReply() || reply == HttpHelper::refusedReply())
        return false;
    const QJsonObject object = QJsonDocument::fromJson(reply.toUtf8()).object();
    const QJsonValue code = object.value(QLatin1String("code"));
    return code.isDouble() && code.toDouble() != 0
        && !object.value(QLatin1String("data")).toObject().contains(QLatin1String("user"));
}

QString accountReply(const CacheControlPtr &record)
{
    if (!record)
        return KestCacheService::passReply(false);
    QByteArray reply;
    reply.reserve(256);
    reply += "{\"pass\":true,\"user\":";
    appendAccountEntry(reply, *record);
    reply += '}';
    return QString::fromUtf8(reply);
}
} // namespace

KestCacheService::KestCacheService(QObject *parent)
    : QObject(parent)
    , m_reachability(std::make_shared<ServerReachability>())
    , m_http(std::make_unique<HttpHelper>(m_reachability))
    , m_groups(std::make_unique<GroupListManager>())
    , m_users(std::make_unique<UserListManager>(m_groups.get()))
    , m_throttle(std::make_unique<LoginThrottle>())
    , m_startedAt(QDateTime::currentSecsSinceEpoch())
{
    connect(this, &KestCacheService::updateCache, this, &KestCacheService::onUpdateCache, Qt::AutoConnection);
}

KestCacheService::~KestCacheService()
{
    stopWorker();
}

void KestCacheService::startWorker()
{
    if (m_worker.joinable())
        return;
    m_stopWorker = false;
    m_worker = std::thread(&KestCacheService::watchServer, this);
}

void KestCacheService::stopWorker()
{
    if (!m_worker.joinable())
        return;
    {
        std::lock_guard<std::mutex> lock(m_workerMutex);
        m_stopWorker = true;
    }
    m_workerWake.notify_all();
    m_worker.join();
}

bool KestCacheService::sleepUnlessStopped()
{
    std::unique_lock<std::mutex> lock(m_workerMutex);
    return !m_workerWake.wait_for(lock, std::chrono::seconds(1), [this]() { return m_stopWorker.load(); });
}

// Probes once a second while the server is out of reach (or not yet refreshed); the first success
// refreshes the local users once, and any success ends an outage.
void KestCacheService::watchServer()
{
    HttpHelper http(m_reachability);
    bool refreshed = false;
    do {
        if (refreshed && !m_reachability->isUnreachable())
            continue;
        QString hostPort;
        if (!http.checkServerAddress(hostPort, &m_stopWorker) || refreshed)
            continue;
        refreshed = true;
        qInfo().noquote() << QStringLiteral("==================>> Q_EMIT updateCache, thread id: ") + threadId();
        Q_EMIT updateCache();
    } while (sleepUnlessStopped());
}

void KestCacheService::beginCall()
{
    m_http->setCallDeadline(QDeadlineTimer(callNetworkBudgetMs));
}

void KestCacheService::onUpdateCache()
{
    qInfo().noquote() << QStringLiteral("=====================>> onUpdateCache, thread id : ") + threadId();
    if (!isEnabled()) {
        cleanDomainUserCacheFiles();
        return;
    }
    m_http->setCallDeadline(QDeadlineTimer(QDeadlineTimer::Forever));
    m_users->rebuildUsers(m_http.get());
    m_lastRefresh = QDateTime::currentSecsSinceEpoch();
    Q_EMIT accountsWritten();
}

bool KestCacheService::isEnabled() const
{
    return GlobalSetting::instance()->isEnabled();
}

UserListManager *KestCacheService::userList() const
{
    return m_users.get();
}

QString KestCacheService::passReply(bool pass)
{
    return pass ? QStringLiteral("{\"pass\":true}") : QStringLiteral("{\"pass\":false}");
}

LoginThrottle *KestCacheService::loginThrottle() const
{
    return m_throttle.get();
}

QString KestCacheService::lockedReply(qint64 until)
{
    const qint64 left = qMax<qint64>(1, until - QDateTime::currentSecsSinceEpoch());
    return QStringLiteral("{\"pass\":false,\"locked\":%1}").arg(left);
}

QString KestCacheService::statusReply(int code, const QString &message)
{
    const QJsonObject object { { QStringLiteral("code"), code }, { QStringLiteral("msg"), message },
        { QStringLiteral("data"), QJsonValue::Null } };
    return QString::fromUtf8(QJsonDocument(object).toJson(QJsonDocument::Compact));
}

bool KestCacheService::validateServerAnswer(const QString &reply, const QString &password, QJsonObject &user)
{
    if (reply == HttpHelper::refusedReply()) {
        qWarning().noquote() << QStringLiteral("server refuse with data: ") + reply;
        return false;
    }
    const QJsonObject object = QJsonDocument::fromJson(reply.toUtf8()).object();
    const QJsonValue data = object.value(QLatin1String("data"));
    if (!data.isObject() || !data.toObject().value(QLatin1String("user")).isObject()) {
        qWarning().noquote() << QStringLiteral("web server does not correspond to client.");
        return false;
    }
    user = data.toObject().value(QLatin1String("user")).toObject();
    const double uid = user.value(QLatin1String("uid")).toDouble();
    if (!(uid >= firstDomainUid) || uid > double(std::numeric_limits<uint>::max())) {
        qWarning().noquote() << QStringLiteral("web server user uid is invalid. received raw data: ") + reply;
        return false;
    }
    user.insert(QStringLiteral("password"),
        password == shadowedPassword ? shadowedPassword : UserListManager::passwordDigest(password));
    return true;
}

QString KestCacheService::answerLookup(
    const QString &reply, bool known, const QString &offlineMessage, const QString &unknownMessage)
{
    if (reply == HttpHelper::unreachableReply()) {
        if (known)
            return passReply(true);
        qWarning().noquote() << offlineMessage;
        return passReply(false);
    }
    if (reply == HttpHelper::unknownAccountReply()) {
        qWarning().noquote() << unknownMessage;
        return passReply(false);
    }
    QJsonObject user;
    if (!validateServerAnswer(reply, shadowedPassword, user))
        return passReply(false);
    // Network accounts carry their "@" on this machine, whichever way they were looked up.
    const QString name = user.value(QLatin1String("name")).toString();
    if (!name.startsWith(QLatin1Char('@')))
        user.insert(QStringLiteral("name"), QLatin1Char('@') + name);
    const UserListManager::Added added = m_users->addUser(user);
    if (added == UserListManager::Added::Refused)
        return passReply(false);
    m_unknown.forget(user.value(QLatin1String("name")).toString(), uint(user.value(QLatin1String("uid")).toDouble()));
    Q_EMIT accountsWritten();
    return passReply(true);
}

QString KestCacheService::queryAccountName(QString name)
{
    if (!isEnabled())
        return passReply(false);
    if (m_unknown.holds(name))
        return passReply(false);
    beginCall();
    const QString reply = m_http->queryUserByName(name);
    if (saysUnknown(reply)) {
        m_unknown.remember(name);
        Q_EMIT negativeAnswersChanged();
    }
    return answerLookup(reply, m_users->hasUserName(name),
        QStringLiteral("offline cache doesnot persist account name: ") + name,
        QStringLiteral("web server doesnot have account name: ") + name);
}

QString KestCacheService::queryUid(uint uid)
{
    if (!isEnabled())
        return passReply(false);
    if (m_unknown.holds(uid))
        return passReply(false);
    beginCall();
    const QString reply = m_http->queryUserByUid(uid);
    if (saysUnknown(reply)) {
        m_unknown.remember(uid);
        Q_EMIT negativeAnswersChanged();
    }
    const QString id = QString::number(uid);
    return answerLookup(reply, m_users->hasUid(uid), QStringLiteral("offline cache doesnot persist account id: ") + id,
        QStringLiteral("web server doesnot have account uid: ") + id);
}

QString KestCacheService::queryGroupName(QString name, QString baseJson)
{
    Q_UNUSED(name)
    Q_UNUSED(baseJson)
    isEnabled();
    return passReply(false);
}

QString KestCacheService::queryGid(uint gid, QString baseJson)
{
    Q_UNUSED(gid)
    Q_UNUSED(baseJson)
    isEnabled();
    return passReply(false);
}

QString KestCacheService::authenticatePassword(QString username, QString password)
{
    if (!isEnabled())
        return passReply(false);
    if (password == shadowedPassword) {
        qWarning().noquote() << QStringLiteral(
            "password should not be x because linux use it to express encrypted password meaning.");
        return passReply(false);
    }
    if (m_unknown.forget(username))
        Q_EMIT negativeAnswersChanged();
    const uint uid = m_users->uidOfName(username);
    if (const qint64 until = m_throttle->lockedUntil(uid))
        return lockedReply(until);
    const QString answer = checkPassword(username, password, uid);
    if (answer == passReply(true))
        m_throttle->recordSuccess(uid);
    return answer;
}

// Only a password found wrong counts toward the limit, and only for an account this machine knows.
QString KestCacheService::checkPassword(const QString &username, const QString &password, uint uid)
{
    beginCall();
    const QString reply = m_http->authenticate(username, password, QStringLiteral("password"));
    if (reply == HttpHelper::unreachableReply()) {
        if (!checkOfflineLogin(username, uid))
            return passReply(false);
        if (!m_users->checkOfflinePassword(username, password)) {
            if (uid != 0)
                m_throttle->recordFailure(uid, username);
            return passReply(false);
        }
        qInfo().noquote() << QStringLiteral("[authenticatePassword]: Offline login verification successful");
        return passReply(true);
    }
    if (reply == HttpHelper::refusedReply()) {
        qWarning().noquote() << QStringLiteral("web server does not correspond to client.");
        return passReply(false);
    }
    const QJsonObject answer = QJsonDocument::fromJson(reply.toUtf8()).object();
    const QJsonValue result = answer.value(QLatin1String("data")).toObject().value(QLatin1String("result"));
    if (answer.value(QLatin1String("code")).toInt() != 0 || !answer.contains(QLatin1String("data")) || !result.isBool()
        || !result.toBool()) {
        qInfo().noquote() << QStringLiteral("authenticate for user: ") + username
                + QStringLiteral(", server returned: ") + reply + QStringLiteral(", compare result: ")
                + QStringLiteral("false");
        if (uid != 0)
            m_throttle->recordFailure(uid, username);
        return passReply(false);
    }
    QJsonObject user;
    if (!validateServerAnswer(m_http->queryUserByName(username), password, user)) {
        qWarning().noquote() << QStringLiteral("user passed by web server but lost themself identification.");
        return passReply(false);
    }
    // The server decides the login; files that cannot be stored only mean it is not kept for later.
    const UserListManager::Added added = m_users->addUser(user);
    if (added == UserListManager::Added::Refused)
        return passReply(false);
    if (added == UserListManager::Added::Written)
        m_users->recordLogin(username);
    m_unknown.forget(username, uint(user.value(QLatin1String("uid")).toDouble()));
    Q_EMIT accountsWritten();
    HomeDirectoryRepair::repair(username, *m_users);
    return passReply(true);
}

QString KestCacheService::modifyUser(QString json)
{
    if (!isEnabled())
        return passReply(false);
    const QJsonDocument document = QJsonDocument::fromJson(json.toUtf8());
    if (!document.isObject()) {
        qWarning().noquote() << QStringLiteral("invalid json string");
        return statusReply(1, QStringLiteral("json解析失败"));
    }
    const QJsonObject request = document.object();
    if (!request.contains(QLatin1String("username")) || !request.contains(QLatin1String("password"))
        || !request.contains(QLatin1String("old_password"))) {
        qWarning().noquote() << QStringLiteral("required json filed is missing.");
        return statusReply(2, QStringLiteral("json解析失败,缺少必要的字段"));
    }
    const QString userName = request.value(QLatin1String("username")).toString();
    const QString newPassword = request.value(QLatin1String("password")).toString();
    const QString oldPassword = request.value(QLatin1String("old_password")).toString();
    const uint uid = m_users->uidOfName(userName);
    if (uid < firstDomainUid) {
        qWarning().noquote() << QStringLiteral("donot validate for not remote account.");
        return statusReply(3, QStringLiteral("校验域账号失败,不能查询到此账户信息"));
    }
    if (const qint64 until = m_throttle->lockedUntil(uid)) {
        const qint64 minutes = (until - QDateTime::currentSecsSinceEpoch() + 59) / 60;
        return statusReply(5, QStringLiteral("account locked, try again in %1 minutes").arg(qMax<qint64>(1, minutes)));
    }
    beginCall();
    const QString reply = m_http->resetPassword(uid, userName, newPassword, oldPassword);
    if (reply == HttpHelper::unreachableReply() || reply == HttpHelper::refusedReply()) {
        qWarning().noquote() << QStringLiteral("network error or donot authenticate pass.");
        return statusReply(4, QStringLiteral("网络错误,无法修改密码"));
    }
    // Only a change the server accepted may replace the digest kept for offline logins; one it refused is
    // taken as a wrong old password.
    if (QJsonDocument::fromJson(reply.toUtf8()).object().value(QLatin1String("code")).toInt(-1) != 0) {
        m_throttle->recordFailure(uid, userName);
        return reply;
    }
    m_throttle->recordSuccess(uid);
    QJsonObject user;
    if (!validateServerAnswer(m_http->queryUserByName(userName), newPassword, user))
        qWarning().noquote() << QStringLiteral("web server successed, but lost user detail information");
    else
        m_users->addUser(user);
    Q_EMIT accountsWritten();
    return reply;
}

QString KestCacheService::getAccountByName(QString name)
{
    if (!isEnabled())
        return passReply(false);
    const CacheControlPtr record = shownAccount(m_users->uidOfName(name));
    return accountReply(record && record->account() == name ? record : CacheControlPtr());
}

QString KestCacheService::getAccountByUid(uint uid)
{
    if (!isEnabled())
        return passReply(false);
    return accountReply(shownAccount(uid));
}

QString KestCacheService::listAccounts()
{
    if (!isEnabled())
        return passReply(false);
    QByteArray reply = "{\"pass\":true,\"users\":[";
    // In uid order, so that a listing reads the same each time.
    QList<quint32> uids = listCacheUids();
    std::sort(uids.begin(), uids.end());
    bool first = true;
    for (const quint32 uid : uids) {
        if (const CacheControlPtr record = shownAccount(uid)) {
            if (!first)
                reply += ',';
            appendAccountEntry(reply, *record);
            first = false;
        }
    }
    reply += "]}";
    return QString::fromUtf8(reply);
}

QString KestCacheService::changePassword(
    const QString &userName, const QString &newPassword, const QString &oldPassword)
{
    if (!isEnabled())
        return passReply(false);
    return m_http->resetPassword(m_users->uidOfName(userName), userName, newPassword, oldPassword);
}

ServerReachability::Snapshot KestCacheService::serverState() const
{
    return m_reachability->snapshot();
}
