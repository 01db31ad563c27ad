#include "common.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QTest>

#include <arpa/inet.h>
#include <thread>
#include <unistd.h>
#include <utility>

namespace
{
// A listening socket on 127.0.0.1; serve() answers one connection from a thread and keeps its request.
struct Peer {
    Peer()
    {
        sockaddr_in address {};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof(address);
        bind(fd, reinterpret_cast<sockaddr *>(&address), length);
        listen(fd, 1);
        getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length);
        port = ntohs(address.sin_port);
    }
    ~Peer() { stop(); }
    // Nobody listens on the port any more; the answering thread has ended.
    void stop()
    {
        shutdown(fd, SHUT_RDWR);
        if (thread.joinable())
            thread.join();
        close(std::exchange(fd, -1));
    }
    void serve(const QByteArray &answer)
    {
        thread = std::thread([this, answer]() {
            const int connection = accept(fd, nullptr, nullptr);
            char buffer[256];
            received = QByteArray(buffer, int(qMax<ssize_t>(recv(connection, buffer, sizeof(buffer), 0), 0)));
            send(connection, answer.constData(), size_t(answer.size()), MSG_NOSIGNAL);
            close(connection);
        });
    }
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    quint16 port = 0;
    QByteArray received;
    std::thread thread;
};
} // namespace

class QueryClientTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void init() { SyslogCapture::clear(); }

    void readPort_data()
    {
        QTest::addColumn<QByteArray>("content");
        QTest::addColumn<int>("port"); // -1: no port
        QTest::newRow("pid and port") << QByteArray("4711\r\n10080\r\n\n") << 10080;
        QTest::newRow("pid only") << QByteArray("4711\n7") << 4711;
        QTest::newRow("not digits") << QByteArray("4711\n80a\n") << -1;
        QTest::newRow("wraps at 65536") << QByteArray("4711\n70000\n") << 4464;
        QTest::newRow("empty") << QByteArray("") << -1;
    }

    void readPort()
    {
        QFETCH(QByteArray, content);
        QFETCH(int, port);
        TestRoot root;
        QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"), content));
        unsigned short read = 0;
        QCOMPARE(read_port(&read), port < 0 ? 0 : 1);
        QCOMPARE(int(read), qMax(port, 0));
    }

    void query_data()
    {
        QTest::addColumn<bool>("pidFile");
        QTest::addColumn<QByteArray>("answer"); // null: nobody listens
        QTest::addColumn<QByteArray>("result"); // the reply body, or the expected log text on failure
        QTest::newRow("reply is unframed") << true << QByteArray("\0\0\0\5hello", 9) << QByteArray("hello");
        QTest::newRow("no pid file") << false << QByteArray()
                                     << QByteArray(", 297, socket_query, read port failed, code: ");
        QTest::newRow("nothing listening")
            << true << QByteArray()
            << QByteArray(", 303, socket_query, connect socket failed, code: 111, detail: Connection refused");
        QTest::newRow("closed without reply")
            << true << QByteArray("") << QByteArray(", 319, socket_query, receive message failed, code: ");
    }

    void query()
    {
        QFETCH(bool, pidFile);
        QFETCH(QByteArray, answer);
        QFETCH(QByteArray, result);
        TestRoot root;
        Peer peer;
        answer.isNull() ? peer.stop() : peer.serve(answer);
        if (pidFile)
            QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"), "1\n" + QByteArray::number(peer.port)));

        const QByteArray request("\0\0\0\2{}", 6);
        QByteArray reply(64, 0x7f);
        const bool success = answer.size() > 4;
        QCOMPARE(socket_query(request.constData(), size_t(request.size()),
                     reinterpret_cast<unsigned char *>(reply.data()), size_t(reply.size())),
            success ? 1 : 0);
        peer.stop();
        if (success) {
            QCOMPARE(reply, result + QByteArray(reply.size() - result.size(), '\0'));
            QCOMPARE(peer.received, request);
            QVERIFY(SyslogCapture::lines().isEmpty());
            return;
        }
        QCOMPARE(SyslogCapture::lines().size(), 1);
        QCOMPARE(SyslogCapture::lines().first().priority, 3);
        QVERIFY2(SyslogCapture::lines().first().text.contains(", src/c-common/common" + result),
            SyslogCapture::lines().first().text);
    }
};

QTEST_GUILESS_MAIN(QueryClientTest)
#include "test_queryclient.moc"
