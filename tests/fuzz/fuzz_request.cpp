// Fuzz target: one request frame through the cache daemon's request server, over a real loopback
// connection, with the domain server out of reach: framing, JSON, function calls and commands.
#include "fuzzroot.h"
#include "kestcachelocalserver.h"
#include "kestcacheservice.h"

#include <QCoreApplication>
#include <QDeadlineTimer>
#include <QTcpSocket>
#include <QtEndian>

#include <cstdlib>

namespace
{
struct Daemon {
    Daemon()
    {
        const QByteArray settings = "[main]\nenable=true\nip=127.0.0.1\nport=1\nnetwork-timeout=1\n"
                                    "[offline_login]\nenable=true\ncache_validity=1\n";
        FuzzRoot::instance().writeFile(QStringLiteral("/etc/kest-iam.conf"),
            reinterpret_cast<const uint8_t *>(settings.constData()), size_t(settings.size()));
        server.listen(QHostAddress::LocalHost, 0);
        client.connectToHost(QHostAddress::LocalHost, server.serverPort());
        client.waitForConnected(5000);
        QCoreApplication::processEvents();
    }

    static int argc;
    static char *argv[];
    QCoreApplication application { argc, argv };
    KestCacheLocalServer server { new KestCacheService };
    QTcpSocket client;
};
int Daemon::argc = 1;
char *Daemon::argv[] = { const_cast<char *>("fuzz_request"), nullptr };

bool replyComplete(QTcpSocket &client)
{
    if (client.bytesAvailable() < 4)
        return false;
    const quint32 length = qFromBigEndian<quint32>(client.peek(4).constData());
    return client.bytesAvailable() >= qint64(length) + 4;
}
} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    // An empty frame is deliberately left waiting for more bytes: no reply to wait for.
    if (size == 0 || size > 64 * 1024)
        return 0;
    static Daemon daemon;
    QByteArray frame(4, '\0');
    qToBigEndian<quint32>(quint32(size), frame.data());
    frame.append(reinterpret_cast<const char *>(data), int(size));
    daemon.client.write(frame);
    // Every whole frame gets exactly one reply; none within the time is a hang worth reporting.
    const QDeadlineTimer deadline(10000);
    while (!replyComplete(daemon.client)) {
        if (deadline.hasExpired() || daemon.client.state() != QAbstractSocket::ConnectedState)
            std::abort();
        QCoreApplication::processEvents(QEventLoop::AllEvents, 50);
        daemon.client.waitForReadyRead(1);
    }
    const quint32 length = qFromBigEndian<quint32>(daemon.client.read(4).constData());
    daemon.client.read(length);
    return 0;
}
