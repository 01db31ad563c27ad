#include "globalsetting.h"

#include "kestpaths.h"
#include "settingsfile.h"

#include <QDebug>
#include <QFile>
#include <QHostAddress>
#include <QHostInfo>
#include <QSettings>

#include <memory>

struct GlobalSettingOwner {
    std::unique_ptr<GlobalSetting> object { new GlobalSetting };
};

namespace
{
const QString mainGroup = QStringLiteral("main");
const QString urlGroup = QStringLiteral("url");
const QString passwdGroup = QStringLiteral("passwd");
const QString groupGroup = QStringLiteral("group");

QVariant readValue(const QString &group, const QString &key, const QVariant &defaultValue)
{
    return SettingsFile::value(group, key, defaultValue);
}

GlobalSettingOwner owner;
} // namespace

GlobalSetting *globalSetting = owner.object.get();

GlobalSetting::~GlobalSetting() = default;

GlobalSetting *GlobalSetting::instance()
{
    return globalSetting;
}

QString GlobalSetting::readString(const QString &group, const QString &key, const QString &defaultValue) const
{
    return readValue(group, key, defaultValue).toString();
}

int GlobalSetting::readInt(const QString &group, const QString &key, int defaultValue) const
{
    return readValue(group, key, defaultValue).toInt();
}

bool GlobalSetting::readBool(const QString &group, const QString &key, bool defaultValue) const
{
    return readValue(group, key, defaultValue).toBool();
}

QString GlobalSetting::readExistingPath(const QString &key, const QString &warning) const
{
    const QString path = readString(urlGroup, key, QString());
    if (!QFile::exists(path))
        SettingsFile::warnOncePerVersion(warning + path);
    return path;
}

QString GlobalSetting::ip() const
{
    return readString(mainGroup, QStringLiteral("ip"), QStringLiteral("127.0.0.1"));
}

QString GlobalSetting::serverAddress() const
{
    const QString configured = ip();
    QHostAddress literal;
    if (literal.setAddress(configured))
        return configured;

    const QHostInfo info = QHostInfo::fromName(configured);
    if (info.error() != QHostInfo::NoError) {
        qWarning().noquote() << QStringLiteral("IP Lookup failed ") + info.errorString();
        return configured;
    }
    const QList<QHostAddress> addresses = info.addresses();
    for (const QHostAddress &address : addresses) {
        if (address.protocol() == QAbstractSocket::IPv4Protocol)
            return address.toString();
    }
    return addresses.isEmpty() ? configured : addresses.first().toString();
}

QString GlobalSetting::entryption() const
{
    return readString(mainGroup, QStringLiteral("entryption"), QStringLiteral("aes"));
}

QString GlobalSetting::domain() const
{
    return readString(mainGroup, QStringLiteral("domain"), QStringLiteral("@"));
}

QString GlobalSetting::homeRoot() const
{
    return readString(mainGroup, QStringLiteral("home"), QStringLiteral("/home/remote"));
}

QString GlobalSetting::protocol() const
{
    return readString(urlGroup, QStringLiteral("protocol"), QStringLiteral("https://"));
}

QString GlobalSetting::userUrl() const
{
    return readString(urlGroup, QStringLiteral("user"), QStringLiteral("/v3/account/"));
}

QString GlobalSetting::resetPasswordUrl() const
{
    return readString(urlGroup, QStringLiteral("reset_password"), QStringLiteral("/v3/client/reset_password"));
}

QString GlobalSetting::groupUrl() const
{
    return readString(urlGroup, QStringLiteral("group"), QStringLiteral("/v3/group/"));
}

QString GlobalSetting::authUrl() const
{
    return readString(urlGroup, QStringLiteral("auth"), QStringLiteral("/v1/auth/"));
}

QString GlobalSetting::domainUrl() const
{
    return readString(urlGroup, QStringLiteral("domain"), QStringLiteral("/v1/domain/"));
}

QString GlobalSetting::serverCert() const
{
    return readExistingPath(QStringLiteral("server-cert"), QStringLiteral("server cert file is not exists. config: "));
}

QString GlobalSetting::privateKey() const
{
    return readExistingPath(
        QStringLiteral("private-key"), QStringLiteral("client private key file is not exists. config: "));
}

QString GlobalSetting::publicKey() const
{
    return readExistingPath(
        QStringLiteral("public-key"), QStringLiteral("client public key file is not exists. config: "));
}

int GlobalSetting::port() const
{
    return readInt(mainGroup, QStringLiteral("port"), 10080);
}

int GlobalSetting::networkTimeout() const
{
    return readInt(mainGroup, QStringLiteral("network-timeout"), 5);
}

int GlobalSetting::networkFrequency() const
{
    return readInt(mainGroup, QStringLiteral("network-frequency"), 100);
}

int GlobalSetting::dbusTimeout() const
{
    return readInt(mainGroup, QStringLiteral("dbus-timeout"), 5);
}

int GlobalSetting::passwdLengthLimit() const
{
    return readInt(passwdGroup, QStringLiteral("length-limit"), 64);
}

int GlobalSetting::passwdBufferLimit() const
{
    return readInt(passwdGroup, QStringLiteral("buffer-limit"), 512);
}

int GlobalSetting::groupLengthLimit() const
{
    return readInt(groupGroup, QStringLiteral("length-limit"), 64);
}

int GlobalSetting::groupMemberCountLimit() const
{
    return readInt(groupGroup, QStringLiteral("member-count-limit"), 64);
}

int GlobalSetting::groupBufferLimit() const
{
    return readInt(groupGroup, QStringLiteral("buffer-limit"), 5120);
}

bool GlobalSetting::isDebug() const
{
    const bool debug = readBool(mainGroup, QStringLiteral("debug"), false);
    if (debug)
        qWarning().noquote() << QStringLiteral("danger! current run in debug mode.");
    return debug;
}

bool GlobalSetting::isEnabled() const
{
    return readBool(mainGroup, QStringLiteral("enable"), false);
}

int GlobalSetting::negativeCacheTimeout() const
{
    return readInt(mainGroup, QStringLiteral("negative-cache-timeout"), 15);
}
