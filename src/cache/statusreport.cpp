#include "statusreport.h"

#include "cachecontrolfactory.h"
#include "cachestore.h"
#include "globalsetting.h"
#include "kestcacheservice.h"
#include "loginthrottle.h"
#include "serverreachability.h"
#include "settingsfile.h"

#include <QDateTime>
#include <QFile>
#include <QJsonArray>

#include <algorithm>

namespace
{
const uint firstDomainUid = 10000;

QJsonObject failure(const QString &message)
{
    return QJsonObject { { QStringLiteral("retVal"), 1 }, { QStringLiteral("errorMessage"), message } };
}

// The offline-login decision in the order the login itself makes it, then the lock of failed attempts.
QJsonObject offlineLogin(const CacheControlInterface &record, qint64 lockedUntil, qint64 now)
{
    const bool enabled = SettingsFile::value(QStringLiteral("offline_login"), QStringLiteral("enable"), false).toBool();
    const qint64 until = qint64(record.lastLoginTime()) + qint64(cacheValiditySeconds());
    QString refusal;
    if (record.removeStatus() != 0)
        refusal = QStringLiteral("marked for removal");
    else if (!record.isCacheEffective())
        refusal = QStringLiteral("expired");
    else if (!enabled)
        refusal = QStringLiteral("switched off");
    else if (lockedUntil > now)
        refusal = QStringLiteral("locked after failed attempts");
    QJsonObject verdict { { QStringLiteral("allowed"), refusal.isEmpty() },
        { QStringLiteral("until"), StatusReport::timeValue(until) } };
    if (!refusal.isEmpty())
        verdict.insert(QStringLiteral("reason"), refusal);
    if (lockedUntil > now)
        verdict.insert(QStringLiteral("lockedUntil"), StatusReport::timeValue(lockedUntil));
    return verdict;
}

QJsonObject accountEntry(const KestCacheService &service, const CacheControlInterface &record, qint64 now)
{
    return QJsonObject { { QStringLiteral("uid"), qint64(record.uid()) }, { QStringLiteral("name"), record.account() },
        { QStringLiteral("lastOnlineLogin"), StatusReport::timeValue(qint64(record.lastLoginTime())) },
        { QStringLiteral("offlineLogin"),
            offlineLogin(record, service.loginThrottle()->lockedUntil(record.uid()), now) },
        { QStringLiteral("home"), record.homePath() } };
}

// 0 when no record answers to the name or uid.
quint32 selectedUid(const QString &account)
{
    bool isNumber = false;
    const quint32 uid = account.toUInt(&isNumber);
    if (isNumber)
        return QFile::exists(cacheFilePathOfUid(uid)) ? uid : 0;
    quint32 found = 0;
    return findCacheUidByAccount(account, found) ? found : 0;
}

QJsonObject generalPart(const KestCacheService &service, int cachedAccounts)
{
    const GlobalSetting *settings = GlobalSetting::instance();
    const ServerReachability::Snapshot server = service.serverState();
    QJsonObject status { { QStringLiteral("retVal"), 0 }, { QStringLiteral("errorMessage"), QString() },
        { QStringLiteral("enabled"), settings->isEnabled() },
        { QStringLiteral("server"),
            QJsonObject {
                { QStringLiteral("address"), settings->ip() }, { QStringLiteral("port"), settings->port() } } },
        { QStringLiteral("state"),
            server.known && !server.unreachable ? QStringLiteral("online") : QStringLiteral("offline") },
        { QStringLiteral("since"), StatusReport::timeValue(server.known ? server.since : service.startedAt()) },
        { QStringLiteral("lastContact"), StatusReport::timeValue(server.lastContact) },
        { QStringLiteral("lastRefresh"), StatusReport::timeValue(service.lastRefresh()) },
        { QStringLiteral("cachedAccounts"), cachedAccounts } };
    if (!server.known)
        status.insert(QStringLiteral("reason"), QStringLiteral("the server was not tried yet"));
    else if (server.unreachable)
        status.insert(QStringLiteral("reason"), server.detail);
    return status;
}
} // namespace

QJsonValue StatusReport::timeValue(qint64 secondsSinceEpoch)
{
    if (secondsSinceEpoch <= 0)
        return QJsonValue::Null;
    return QDateTime::fromSecsSinceEpoch(secondsSinceEpoch, Qt::UTC).toString(Qt::ISODate);
}

QJsonObject StatusReport::build(const KestCacheService &service, qint64 peerUid, const QString &account)
{
    QList<quint32> uids = listCacheUids();
    uids.erase(std::remove_if(uids.begin(), uids.end(), [](quint32 uid) { return uid < firstDomainUid; }), uids.end());
    std::sort(uids.begin(), uids.end());
    QList<quint32> shown;
    if (!account.isEmpty()) {
        const quint32 uid = selectedUid(account);
        if (peerUid != 0 && (uid == 0 || qint64(uid) != peerUid))
            return failure(QStringLiteral("permission denied !!!"));
        if (uid == 0)
            return failure(QStringLiteral("no cache record of: ") + account);
        shown.append(uid);
    } else {
        std::copy_if(uids.cbegin(), uids.cend(), std::back_inserter(shown),
            [peerUid](quint32 uid) { return peerUid == 0 || qint64(uid) == peerUid; });
    }
    QJsonObject status = generalPart(service, uids.size());
    if (peerUid < 0)
        return status;
    const qint64 now = QDateTime::currentSecsSinceEpoch();
    QJsonArray accounts;
    for (const quint32 uid : qAsConst(shown)) {
        if (const CacheControlPtr record = readCacheRecord(uid))
            accounts.append(accountEntry(service, *record, now));
    }
    status.insert(QStringLiteral("accounts"), accounts);
    return status;
}
