#include "offlinelogin.h"

#include "cachestore.h"
#include "settingsfile.h"

#include <QDebug>

namespace
{
bool offlineLoginEnabled()
{
    return SettingsFile::value(QStringLiteral("offline_login"), QStringLiteral("enable"), false).toBool();
}

} // namespace

// The order of the tests decides which single warning a refusal leaves.
bool checkOfflineLogin(const QString &account, quint32 knownUid)
{
    quint32 uid = 0;
    CacheControlPtr record;
    if (!findCacheUidByAccount(account, uid, knownUid, &record)) {
        qWarning().noquote() << QStringLiteral("[checkOfflineLogin]: Cache file not found");
        return false;
    }
    const bool enabled = offlineLoginEnabled();
    if (record->removeStatus() != 0) {
        qWarning().noquote() << QStringLiteral("[removeStatus]: The cache file is marked for deletion: ")
                + QString::number(record->removeStatus());
        return false;
    }
    if (!record->isCacheEffective()) {
        qWarning().noquote() << QStringLiteral("[checkCacheEffectiveSeconds]: false");
        return false;
    }
    if (!enabled) {
        qWarning().noquote() << QStringLiteral("[offline_login_enable]: false");
        return false;
    }
    return true;
}
