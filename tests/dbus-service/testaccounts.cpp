#include "testaccounts.h"

#include "cachecontrolfactory.h"
#include "cachestore.h"

#include <QDBusVariant>
#include <QJsonDocument>
#include <QJsonObject>

#include <algorithm>

namespace
{
const int callTimeoutMs = 60000;
const QString serviceName = QStringLiteral("com.nimbal.kest.iam");
const QString propertiesInterface = QStringLiteral("org.freedesktop.DBus.Properties");
} // namespace

TestAccount testAccount(uint uid, const QString &name)
{
    return TestAccount { uid, uid + 100, name, QStringLiteral("digest-of-") + name,
        QStringLiteral("/home/remote/") + name, QStringLiteral("/bin/zsh"), QStringLiteral("Full Name of ") + name };
}

bool writeCacheRecord(const TestAccount &account)
{
    const QJsonObject json { { QStringLiteral("version"), 16777216 }, { QStringLiteral("uid"), qint64(account.uid) },
        { QStringLiteral("account"), account.name }, { QStringLiteral("main_gid"), qint64(account.gid) },
        { QStringLiteral("home_path"), account.home }, { QStringLiteral("login_shell"), account.shell },
        { QStringLiteral("gecos"), account.gecos }, { QStringLiteral("password"), account.password },
        { QStringLiteral("remove_status"), qint64(account.removeStatus) } };
    CacheControlPtr record = createCacheControl();
    if (!cacheRecordFromJson(record, QString::fromUtf8(QJsonDocument(json).toJson(QJsonDocument::Compact))))
        return false;
    return saveCacheRecord(*record);
}

bool writeCacheRecords(const QList<TestAccount> &accounts)
{
    for (const TestAccount &account : accounts) {
        if (!writeCacheRecord(account))
            return false;
    }
    return true;
}

QList<uint> cachedUids()
{
    const QList<quint32> listed = listCacheUids();
    QList<uint> uids(listed.cbegin(), listed.cend());
    std::sort(uids.begin(), uids.end());
    return uids;
}

QString servicePath()
{
    return QStringLiteral("/com/nimbal/kest/iam");
}

QString userObjectPath(uint uid)
{
    return QStringLiteral("/com/nimbal/kest/iam/user") + QString::number(uid);
}

QDBusMessage callService(const QDBusConnection &bus, const QString &member, const QVariantList &arguments)
{
    QDBusMessage call
        = QDBusMessage::createMethodCall(serviceName, servicePath(), QStringLiteral("com.nimbal.kest.iam"), member);
    call.setArguments(arguments);
    return bus.call(call, QDBus::BlockWithGui, callTimeoutMs);
}

QVariant userProperty(const QDBusConnection &bus, uint uid, const QString &property)
{
    QDBusMessage call
        = QDBusMessage::createMethodCall(serviceName, userObjectPath(uid), propertiesInterface, QStringLiteral("Get"));
    call << QStringLiteral("com.nimbal.kest.iam.user") << property;
    const QDBusMessage reply = bus.call(call, QDBus::BlockWithGui, callTimeoutMs);
    if (reply.type() != QDBusMessage::ReplyMessage || reply.arguments().isEmpty())
        return QVariant();
    return reply.arguments().constFirst().value<QDBusVariant>().variant();
}

QDBusMessage setEnableProperty(const QDBusConnection &bus, bool enable)
{
    QDBusMessage call
        = QDBusMessage::createMethodCall(serviceName, servicePath(), propertiesInterface, QStringLiteral("Set"));
    call << QStringLiteral("com.nimbal.kest.iam") << QStringLiteral("Enable")
         << QVariant::fromValue(QDBusVariant(enable));
    return bus.call(call, QDBus::BlockWithGui, callTimeoutMs);
}
