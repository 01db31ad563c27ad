#include "domainserverfixture.h"

#include <QDeadlineTimer>
#include <QFile>
#include <QJsonDocument>
#include <QMap>

namespace
{
QString buildPath(const QString &name)
{
    return qEnvironmentVariable("KEST_TEST_BINARY_DIR") + QStringLiteral("/tools/test-domain-server/") + name;
}
} // namespace

DomainServerFixture::DomainServerFixture()
{
    m_valid
        = m_dir.isValid() && makeCertificates(m_dir.path(), &m_error) && setData(defaultData()) && clearMisbehaviour();
}

QJsonObject DomainServerFixture::defaultData()
{
    return QJsonDocument::fromJson(R"({"domain": "kest.test",
        "users": [
            {"uid": 10001, "name": "alice", "password": "alice-password", "permissions": ["sudo", "lp"],
             "primary_group": {"id": 10000, "name": "kest"}, "gecos": "Alice", "home": "/home/alice",
             "shell": "/bin/bash"},
            {"uid": 10002, "name": "bob", "password": "bob-password", "permissions": [],
             "primary_group": {"id": 10000, "name": "kest"}, "gecos": "Bob", "home": "/home/bob",
             "shell": "/bin/bash"}],
        "groups": [{"gid": 10000, "name": "kest", "members": ["alice", "bob"]},
                   {"gid": 10010, "name": "staff", "members": ["alice"]}]})")
        .object();
}

bool DomainServerFixture::makeCertificates(const QString &directory, QString *error)
{
    QProcess script;
    script.start(QStringLiteral("bash"), { buildPath(QStringLiteral("make-test-certs.sh")), directory });
    if (script.waitForFinished(60000) && script.exitStatus() == QProcess::NormalExit && script.exitCode() == 0)
        return true;
    if (error)
        *error = QStringLiteral("make-test-certs.sh failed: ") + QString::fromLocal8Bit(script.readAllStandardError());
    return false;
}

bool DomainServerFixture::start(quint16 port, bool plain, const QString &certificate)
{
    stop();
    QStringList arguments { QStringLiteral("--address"), m_listen, QStringLiteral("--port"), QString::number(port),
        QStringLiteral("--data"), pathOf("data.json"), QStringLiteral("--behaviour"), pathOf("behaviour.json"),
        QStringLiteral("--log"), pathOf("requests.log") };
    if (plain)
        arguments << QStringLiteral("--plain");
    else
        arguments << QStringLiteral("--cert") << m_dir.filePath(certificate + QStringLiteral(".pem"))
                  << QStringLiteral("--key") << m_dir.filePath(certificate + QStringLiteral(".key"))
                  << QStringLiteral("--ca") << pathOf("ca.pem");
    m_server.setProcessChannelMode(QProcess::ForwardedErrorChannel);
    m_server.start(buildPath(QStringLiteral("kest-test-domain-server")), arguments);
    // The server's one line on standard output names the port it listens on.
    const QByteArray prefix = "listening on " + m_listen.toLatin1() + ':';
    const QDeadlineTimer deadline(15000);
    while (!m_server.canReadLine() && m_server.waitForReadyRead(static_cast<int>(deadline.remainingTime()))) { }
    const QByteArray line = m_server.readLine().trimmed();
    if (line.startsWith(prefix)) {
        m_port = static_cast<quint16>(line.mid(prefix.size()).toUInt());
        return true;
    }
    m_error = QStringLiteral("the test domain server did not start: ") + m_server.errorString();
    stop();
    return false;
}

void DomainServerFixture::stop()
{
    if (m_server.state() == QProcess::NotRunning)
        return;
    m_server.terminate();
    if (!m_server.waitForFinished(5000)) {
        m_server.kill();
        m_server.waitForFinished(5000);
    }
}

bool DomainServerFixture::setMisbehaviour(const QString &path, const QString &behaviour)
{
    QFile file(pathOf("behaviour.json"));
    QJsonObject paths
        = file.open(QIODevice::ReadOnly) ? QJsonDocument::fromJson(file.readAll()).object() : QJsonObject();
    if (behaviour.isEmpty())
        paths.remove(path);
    else
        paths.insert(path, behaviour);
    return writeJson(QStringLiteral("behaviour.json"), paths);
}

QList<QJsonObject> DomainServerFixture::requests() const
{
    QList<QJsonObject> result;
    QFile file(pathOf("requests.log"));
    if (!file.open(QIODevice::ReadOnly))
        return result;
    while (!file.atEnd()) {
        const QByteArray line = file.readLine().trimmed();
        if (!line.isEmpty())
            result.append(QJsonDocument::fromJson(line).object());
    }
    return result;
}

bool DomainServerFixture::clearRequests()
{
    QFile file(pathOf("requests.log"));
    return !file.exists() || file.resize(0);
}

QByteArray DomainServerFixture::settingsIni(const QVariantMap &overrides) const
{
    QMap<QString, QVariant> values { { QStringLiteral("main/ip"), m_listen }, { QStringLiteral("main/port"), m_port },
        { QStringLiteral("main/network-timeout"), 5 }, { QStringLiteral("url/server-cert"), pathOf("ca.pem") },
        { QStringLiteral("url/public-key"), pathOf("client.pem") },
        { QStringLiteral("url/private-key"), pathOf("client.key") } };
    for (auto it = overrides.cbegin(); it != overrides.cend(); ++it) {
        if (it.value().isValid())
            values.insert(it.key(), it.value());
        else
            values.remove(it.key());
    }
    // Sorted keys keep each group's keys together under one header.
    QByteArray ini;
    QString group;
    for (auto it = values.cbegin(); it != values.cend(); ++it) {
        if (it.key().section(QLatin1Char('/'), 0, 0) != group)
            ini += '[' + (group = it.key().section(QLatin1Char('/'), 0, 0)).toUtf8() + "]\n";
        ini += it.key().section(QLatin1Char('/'), 1).toUtf8() + '=' + it.value().toString().toUtf8() + '\n';
    }
    return ini;
}

bool DomainServerFixture::writeJson(const QString &name, const QJsonObject &object) const
{
    QFile file(m_dir.filePath(name));
    const QByteArray text = QJsonDocument(object).toJson();
    return file.open(QIODevice::WriteOnly | QIODevice::Truncate) && file.write(text) == text.size();
}
