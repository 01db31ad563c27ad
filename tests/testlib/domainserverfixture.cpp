#include "domainserverfixture.h"

#include <QDeadlineTimer>
#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>
#include <QMap>

namespace
{
const int startTimeoutMs = 15000;
const int certificateTimeoutMs = 60000;

QString buildPath(const QString &relative)
{
    return qEnvironmentVariable("KEST_TEST_BINARY_DIR") + QStringLiteral("/tools/test-domain-server/") + relative;
}

QJsonObject user(int uid, const QString &name, const QString &password, const QJsonArray &permissions)
{
    return QJsonObject {
        { QStringLiteral("uid"), uid },
        { QStringLiteral("name"), name },
        { QStringLiteral("password"), password },
        { QStringLiteral("primary_group"),
            QJsonObject { { QStringLiteral("id"), 10000 }, { QStringLiteral("name"), QStringLiteral("kest") } } },
        { QStringLiteral("permissions"), permissions },
        { QStringLiteral("gecos"), name.at(0).toUpper() + name.mid(1) },
        { QStringLiteral("home"), QStringLiteral("/home/") + name },
        { QStringLiteral("shell"), QStringLiteral("/bin/bash") },
    };
}

QJsonObject group(int gid, const QString &name, const QJsonArray &members)
{
    return QJsonObject { { QStringLiteral("gid"), gid }, { QStringLiteral("name"), name },
        { QStringLiteral("members"), members } };
}
} // namespace

DomainServerFixture::DomainServerFixture()
{
    if (!m_dir.isValid()) {
        m_error = QStringLiteral("cannot create a temporary directory");
        return;
    }
    m_valid = makeCertificates(m_dir.path(), &m_error) && setData(defaultData()) && clearMisbehaviour();
}

DomainServerFixture::~DomainServerFixture()
{
    stop();
}

bool DomainServerFixture::isValid() const
{
    return m_valid;
}

QString DomainServerFixture::errorText() const
{
    return m_error;
}

QString DomainServerFixture::address()
{
    return QStringLiteral("127.0.0.2");
}

QJsonObject DomainServerFixture::defaultData()
{
    const QJsonArray users { user(10001, QStringLiteral("alice"), QStringLiteral("alice-password"),
                                 QJsonArray { QStringLiteral("sudo"), QStringLiteral("lp") }),
        user(10002, QStringLiteral("bob"), QStringLiteral("bob-password"), QJsonArray()) };
    const QJsonArray groups { group(10000, QStringLiteral("kest"),
                                  QJsonArray { QStringLiteral("alice"), QStringLiteral("bob") }),
        group(10010, QStringLiteral("staff"), QJsonArray { QStringLiteral("alice") }) };
    return QJsonObject { { QStringLiteral("domain"), QStringLiteral("kest.test") }, { QStringLiteral("users"), users },
        { QStringLiteral("groups"), groups } };
}

bool DomainServerFixture::makeCertificates(const QString &directory, QString *error)
{
    QProcess script;
    script.setProgram(QStringLiteral("bash"));
    script.setArguments({ buildPath(QStringLiteral("make-test-certs.sh")), directory });
    script.start();
    const bool finished = script.waitForFinished(certificateTimeoutMs);
    if (finished && script.exitStatus() == QProcess::NormalExit && script.exitCode() == 0)
        return true;
    if (error)
        *error = QStringLiteral("make-test-certs.sh failed: ") + QString::fromLocal8Bit(script.readAllStandardError());
    return false;
}

bool DomainServerFixture::start(quint16 port)
{
    stop();
    QStringList arguments { QStringLiteral("--address"), address(), QStringLiteral("--port"), QString::number(port),
        QStringLiteral("--data"), dataFile(), QStringLiteral("--behaviour"), filePath(QStringLiteral("behaviour.json")),
        QStringLiteral("--log"), filePath(QStringLiteral("requests.log")) };
    if (m_plain)
        arguments << QStringLiteral("--plain");
    else
        arguments << QStringLiteral("--cert") << filePath(QStringLiteral("server.pem")) << QStringLiteral("--key")
                  << filePath(QStringLiteral("server.key")) << QStringLiteral("--ca") << caFile();
    m_server.setProgram(buildPath(QStringLiteral("kest-test-domain-server")));
    m_server.setArguments(arguments);
    m_server.setProcessChannelMode(QProcess::ForwardedErrorChannel);
    m_server.start();
    if (!m_server.waitForStarted(startTimeoutMs)) {
        m_error = QStringLiteral("the test domain server did not start: ") + m_server.errorString();
        return false;
    }
    return waitForListening();
}

bool DomainServerFixture::waitForListening()
{
    const QByteArray prefix = "listening on " + address().toLatin1() + ':';
    const QDeadlineTimer deadline(startTimeoutMs);
    while (!deadline.hasExpired()) {
        while (m_server.canReadLine()) {
            const QByteArray line = m_server.readLine().trimmed();
            if (line.startsWith(prefix)) {
                m_port = static_cast<quint16>(line.mid(prefix.size()).toUInt());
                return true;
            }
        }
        if (m_server.state() != QProcess::Running
            || !m_server.waitForReadyRead(static_cast<int>(deadline.remainingTime())))
            break;
    }
    m_error = QStringLiteral("the test domain server did not report its port");
    stop();
    return false;
}

bool DomainServerFixture::restart()
{
    const quint16 previous = m_port;
    stop();
    return start(previous);
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

bool DomainServerFixture::isRunning() const
{
    return m_server.state() == QProcess::Running;
}

quint16 DomainServerFixture::port() const
{
    return m_port;
}

void DomainServerFixture::setPlainHttp(bool plain)
{
    m_plain = plain;
}

QString DomainServerFixture::directory() const
{
    return m_dir.path();
}

QString DomainServerFixture::caFile() const
{
    return filePath(QStringLiteral("ca.pem"));
}

QString DomainServerFixture::clientCertificateFile() const
{
    return filePath(QStringLiteral("client.pem"));
}

QString DomainServerFixture::clientKeyFile() const
{
    return filePath(QStringLiteral("client.key"));
}

QString DomainServerFixture::dataFile() const
{
    return filePath(QStringLiteral("data.json"));
}

bool DomainServerFixture::setData(const QJsonObject &data)
{
    return writeJson(QStringLiteral("data.json"), data);
}

QJsonObject DomainServerFixture::data() const
{
    return readJson(QStringLiteral("data.json"));
}

bool DomainServerFixture::setMisbehaviour(const QString &path, const QString &behaviour)
{
    QJsonObject paths = readJson(QStringLiteral("behaviour.json"));
    if (behaviour.isEmpty())
        paths.remove(path);
    else
        paths.insert(path, behaviour);
    return writeJson(QStringLiteral("behaviour.json"), paths);
}

bool DomainServerFixture::clearMisbehaviour()
{
    return writeJson(QStringLiteral("behaviour.json"), QJsonObject());
}

QList<QJsonObject> DomainServerFixture::requests() const
{
    QList<QJsonObject> result;
    QFile file(filePath(QStringLiteral("requests.log")));
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
    QFile file(filePath(QStringLiteral("requests.log")));
    return !file.exists() || file.resize(0);
}

QByteArray DomainServerFixture::settingsIni(const QVariantMap &overrides) const
{
    QMap<QString, QVariant> values {
        { QStringLiteral("main/ip"), address() },
        { QStringLiteral("main/port"), m_port },
        { QStringLiteral("main/network-timeout"), 5 },
        { QStringLiteral("url/server-cert"), caFile() },
        { QStringLiteral("url/public-key"), clientCertificateFile() },
        { QStringLiteral("url/private-key"), clientKeyFile() },
    };
    for (auto it = overrides.cbegin(); it != overrides.cend(); ++it) {
        if (it.value().isValid())
            values.insert(it.key(), it.value());
        else
            values.remove(it.key());
    }
    // Keys sort by group, so each group's keys come out together under one header.
    QByteArray ini;
    QString currentGroup;
    for (auto it = values.cbegin(); it != values.cend(); ++it) {
        const QString group = it.key().section(QLatin1Char('/'), 0, 0);
        if (group != currentGroup) {
            ini += '[' + group.toUtf8() + "]\n";
            currentGroup = group;
        }
        ini += it.key().section(QLatin1Char('/'), 1).toUtf8() + '=' + it.value().toString().toUtf8() + '\n';
    }
    return ini;
}

QString DomainServerFixture::filePath(const QString &name) const
{
    return m_dir.filePath(name);
}

bool DomainServerFixture::writeJson(const QString &name, const QJsonObject &object) const
{
    QFile file(filePath(name));
    if (!file.open(QIODevice::WriteOnly | QIODevice::Truncate))
        return false;
    const QByteArray text = QJsonDocument(object).toJson();
    return file.write(text) == text.size();
}

QJsonObject DomainServerFixture::readJson(const QString &name) const
{
    QFile file(filePath(name));
    if (!file.open(QIODevice::ReadOnly))
        return QJsonObject();
    return QJsonDocument::fromJson(file.readAll()).object();
}
