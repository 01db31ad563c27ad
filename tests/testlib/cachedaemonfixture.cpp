#include "cachedaemonfixture.h"

#include "rawconnection.h"

#include <QElapsedTimer>
#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QThread>
#include <QtEndian>

namespace
{
const int startTimeoutMs = 15000;

QString pidFile()
{
    return QString::fromLocal8Bit(qgetenv("KEST_IAM_ROOT")) + QStringLiteral("/run/cache-kest.pid");
}

} // namespace

CacheDaemonFixture::~CacheDaemonFixture()
{
    stop();
}

QString CacheDaemonFixture::programPath()
{
    return QString::fromLocal8Bit(qgetenv("KEST_TEST_BINARY_DIR")) + QStringLiteral("/src/cache/cache-kest");
}

QByteArray CacheDaemonFixture::frame(const QByteArray &payload)
{
    QByteArray framed(4, '\0');
    qToBigEndian<quint32>(quint32(payload.size()), framed.data());
    return framed + payload;
}

QByteArray CacheDaemonFixture::functionCall(const QString &name, const QStringList &argv)
{
    const QJsonObject request { { QStringLiteral("version"), 16777216 }, { QStringLiteral("functionName"), name },
        { QStringLiteral("argv"), QJsonArray::fromStringList(argv) } };
    return QJsonDocument(request).toJson(QJsonDocument::Compact);
}

bool CacheDaemonFixture::start()
{
    QFile::remove(pidFile());
    m_daemon.setProgram(programPath());
    m_daemon.setProcessChannelMode(QProcess::ForwardedChannels);
    m_daemon.start();
    if (!m_daemon.waitForStarted(startTimeoutMs)) {
        m_error = QStringLiteral("cache-kest did not start: ") + m_daemon.errorString();
        return false;
    }
    QElapsedTimer timer;
    timer.start();
    while (timer.elapsed() < startTimeoutMs && m_daemon.state() == QProcess::Running) {
        QFile file(pidFile());
        if (file.open(QIODevice::ReadOnly)) {
            const QList<QByteArray> lines = file.readAll().split('\n');
            if (lines.size() >= 2 && lines.at(0).toLongLong() == m_daemon.processId()) {
                m_port = quint16(lines.at(1).toUInt());
                return true;
            }
        }
        QThread::msleep(20);
    }
    m_error = QStringLiteral("cache-kest wrote no pid file; exit code ") + QString::number(m_daemon.exitCode());
    return false;
}

int CacheDaemonFixture::stop()
{
    if (m_daemon.state() == QProcess::NotRunning)
        return m_daemon.exitCode();
    m_daemon.terminate();
    if (!m_daemon.waitForFinished(10000)) {
        m_daemon.kill();
        m_daemon.waitForFinished(5000);
        return -1;
    }
    return m_daemon.exitStatus() == QProcess::NormalExit ? m_daemon.exitCode() : -1;
}

bool CacheDaemonFixture::isRunning() const
{
    return m_daemon.state() == QProcess::Running;
}

quint16 CacheDaemonFixture::port() const
{
    return m_port;
}

qint64 CacheDaemonFixture::pid() const
{
    return m_daemon.processId();
}

QString CacheDaemonFixture::errorText() const
{
    return m_error;
}

QByteArray CacheDaemonFixture::request(const QByteArray &payload, int timeoutMs) const
{
    RawConnection connection(m_port);
    connection.send(frame(payload));
    return connection.reply(timeoutMs);
}

QByteArray CacheDaemonFixture::call(const QString &name, const QStringList &argv) const
{
    return request(functionCall(name, argv));
}

int CacheDaemonFixture::runClient(const QStringList &arguments, QByteArray *out, QByteArray *err) const
{
    QProcess client;
    client.start(programPath(), arguments);
    if (!client.waitForFinished(60000)) {
        client.kill();
        client.waitForFinished();
        return -1;
    }
    if (out)
        *out = client.readAllStandardOutput();
    if (err)
        *err = client.readAllStandardError();
    return client.exitStatus() == QProcess::NormalExit ? client.exitCode() : -1;
}
