#include "cachedaemonfixture.h"

#include "rawconnection.h"

#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QTest>
#include <QtEndian>

#include <grp.h>
#include <sys/wait.h>
#include <unistd.h>

namespace
{
// Runs in the forked child: system calls only, no Qt.
void replyAsUser(uint uid, quint16 port, const QByteArray &frame, int out)
{
    if (setgroups(0, nullptr) != 0 || setresgid(uid, uid, uid) != 0 || setresuid(uid, uid, uid) != 0)
        _exit(2);
    char reply[65536];
    const int length = RawConnection::exchange(port, frame, reply, sizeof(reply));
    _exit(length > 0 && write(out, reply, size_t(length)) == length ? 0 : 3);
}
} // namespace

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

QJsonObject CacheDaemonFixture::Run::json() const
{
    return QJsonDocument::fromJson(out).object();
}

CacheDaemonFixture::Run CacheDaemonFixture::run(const QStringList &arguments, uint uid)
{
    QProcess client;
    if (uid == 0)
        client.start(programPath(), arguments);
    else
        client.start(QStringLiteral("setpriv"),
            QStringList { QStringLiteral("--reuid=%1").arg(uid), QStringLiteral("--regid=%1").arg(uid),
                QStringLiteral("--clear-groups"), programPath() }
                + arguments);
    Run result;
    if (client.waitForFinished(60000) && client.exitStatus() == QProcess::NormalExit)
        result.status = client.exitCode();
    result.out = client.readAllStandardOutput();
    result.err = client.readAllStandardError();
    return result;
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

QByteArray CacheDaemonFixture::requestAsUser(uint uid, const QByteArray &payload) const
{
    int channel[2];
    if (pipe(channel) != 0)
        return QByteArray();
    const QByteArray framed = frame(payload);
    const pid_t child = fork();
    if (child == 0) {
        close(channel[0]);
        replyAsUser(uid, m_port, framed, channel[1]);
    }
    close(channel[1]);
    QByteArray reply;
    char buffer[4096];
    ssize_t received;
    while ((received = read(channel[0], buffer, sizeof(buffer))) > 0)
        reply.append(buffer, int(received));
    close(channel[0]);
    if (child > 0)
        waitpid(child, nullptr, 0);
    return reply.mid(4);
}
