// Fuzz target: one request frame through the cache daemon's request server, over a real loopback
// connection, with the domain server out of reach: framing, JSON, function calls and commands.
#include "fuzzroot.h"
#include "kestcachelocalserver.h"
#include "kestcacheservice.h"

#include <QCoreApplication>
#include <QDeadlineTimer>
#include <QTcpSocket>
#include <QtEndian>

namespace
{
int argc = 1;
char name[] = "fuzz_request";
char *argv[] = { name, nullptr };

struct Daemon {
    Daemon()
    {
        root.writeFile(QStringLiteral("/etc/kest-iam.conf"),
            "[main]\nenable=true\nip=127.0.0.1\nport=1\nnetwork-timeout=1\n"
            "[offline_login]\nenable=true\ncache_validity=1\n");
        server.listen(QHostAddress::LocalHost, 0);
        client.connectToHost(QHostAddress::LocalHost, server.serverPort());
        client.waitForConnected(5000);
        QCoreApplication::processEvents();
    }
    // First, so that the service starts inside the private root.
    const TestRoot &root = fuzzRoot();
    QCoreApplication application { argc, argv };
    KestCacheLocalServer server { new KestCacheService };
    QTcpSocket client;
};

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    // An empty frame is deliberately left waiting for more bytes: no reply to wait for.
    if (size == 0 || size > 64 * 1024)
        return 0;
    static Daemon daemon;
    QTcpSocket &client = daemon.client;
    QByteArray frame(4, '\0');
    qToBigEndian(quint32(size), frame.data());
    client.write(frame + fuzzInput(data, size));
    // Every whole frame gets exactly one reply; none within the time is a hang worth reporting.
    const QDeadlineTimer deadline(10000);
    const auto read = [&](qint64 bytes) {
        while (client.bytesAvailable() < bytes) {
            if (deadline.hasExpired() || client.state() != QAbstractSocket::ConnectedState)
                std::abort();
            QCoreApplication::processEvents(QEventLoop::AllEvents, 50);
            client.waitForReadyRead(1);
        }
        return client.read(bytes);
    };
    read(qFromBigEndian<quint32>(read(4).constData()));
    return 0;
}
