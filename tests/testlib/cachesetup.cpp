#include "cachesetup.h"

#include <QFile>

bool CacheSetup::writeSettings(const QVariantMap &overrides) const
{
    QVariantMap values { { QStringLiteral("main/enable"), true }, { QStringLiteral("main/network-timeout"), 2 },
        { QStringLiteral("offline_login/enable"), true }, { QStringLiteral("offline_login/cache_validity"), 1 } };
    for (auto it = overrides.cbegin(); it != overrides.cend(); ++it)
        values.insert(it.key(), it.value());
    return root.writeSettings(server.settingsIni(values));
}

bool CacheSetup::start(const QVariantMap &overrides)
{
    return server.isValid() && server.start() && writeSettings(overrides) && daemon.start();
}

bool CacheSetup::hasRecord(uint uid) const
{
    return QFile::exists(root.workDir() + QLatin1Char('/') + QString::number(uid));
}

QByteArray CacheSetup::lookUp(const QString &name) const
{
    return daemon.call(QStringLiteral("queryAccountName"), { name });
}

QByteArray CacheSetup::login(const QString &name, const QString &password) const
{
    return daemon.call(QStringLiteral("authenticatePassword"), { name, password });
}
