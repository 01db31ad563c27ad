#include "cachedaemonfixture.h"

#include "rawconnection.h"

#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QTest>
#include <QtEndian>

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
    QFile pidFile(QString::fromLocal8Bit(qgetenv("KEST_IAM_ROOT")) + QStringLiteral("/run/cache-kest.pid"));
    pidFile.remove();
    m_daemon.setProcessChannelMode(QProcess::ForwardedChannels);
    m_daemon.start(programPath(), QStringList());
    const auto listening = [&] {
        const QList<QByteArray> lines
            = pidFile.open(QIODevice::ReadOnly) ? pidFile.readAll().split('\n') : QList<QByteArray>();
        pidFile.close();
        m_port = lines.size() >= 2 && lines.at(0).toLongLong() == m_daemon.processId() ? lines.at(1).toUShort() : 0;
        return m_port != 0 || !isRunning();
    };
    if (m_daemon.waitForStarted(15000) && QTest::qWaitFor(listening, 15000) && m_port != 0)
        return true;
    m_error = QStringLiteral("cache-kest wrote no pid file; exit code ") + QString::number(m_daemon.exitCode());
    return false;
}

int CacheDaemonFixture::stop()
{
    m_daemon.terminate();
    if (!m_daemon.waitForFinished(10000) && isRunning()) {
        m_daemon.kill();
        m_daemon.waitForFinished(5000);
    }
    return m_daemon.exitStatus() == QProcess::NormalExit ? m_daemon.exitCode() : -1;
}

QByteArray CacheDaemonFixture::request(const QByteArray &payload) const
{
    RawConnection connection(m_port);
    connection.send(frame(payload));
    return connection.reply();
}
