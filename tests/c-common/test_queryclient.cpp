#include "common.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QTest>

#include <arpa/inet.h>
#include <thread>
#include <unistd.h>

namespace
{
// A listening socket on 127.0.0.1; serve() takes one connection, keeps the request, sends answer.
class Peer
{
public:
    Peer()
    {
        sockaddr_in address {};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof(address);
        bind(m_fd, reinterpret_cast<sockaddr *>(&address), sizeof(address));
        listen(m_fd, 1);
        getsockname(m_fd, reinterpret_cast<sockaddr *>(&address), &length);
        port = ntohs(address.sin_port);
    }
    ~Peer() { stop(); }
    // Nobody listens on the port any more.
    void stop()
    {
        shutdown(m_fd, SHUT_RDWR);
        if (m_thread.joinable())
            m_thread.join();
        if (m_fd >= 0)
            close(m_fd);
        m_fd = -1;
    }
    void serve(const QByteArray &answer)
    {
        m_thread = std::thread([this, answer]() {
            const int connection = accept(m_fd, nullptr, nullptr);
            char buffer[256];
            const ssize_t got = recv(connection, buffer, sizeof(buffer), 0);
            received = QByteArray(buffer, int(qMax<ssize_t>(got, 0)));
            send(connection, answer.constData(), size_t(answer.size()), MSG_NOSIGNAL);
            close(connection);
        });
    }
    QByteArray request()
    {
        m_thread.join();
        return received;
    }
    quint16 port = 0;
    QByteArray received;

private:
    int m_fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    std::thread m_thread;
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
        QTest::addColumn<QByteArray>("pidFile"); // PORT: the peer's port
        QTest::addColumn<QByteArray>("answer"); // null: nobody listens
        QTest::addColumn<QByteArray>("result"); // the reply body, or the expected log text on failure
        QTest::newRow("reply is unframed")
            << QByteArray("1\nPORT\n") << QByteArray("\0\0\0\5hello", 9) << QByteArray("hello");
        QTest::newRow("no pid file") << QByteArray() << QByteArray()
                                     << QByteArray(", 297, socket_query, read port failed, code: ");
        QTest::newRow("port not digits") << QByteArray("1\n80a\n") << QByteArray()
                                         << QByteArray(", 297, socket_query, read port failed, code: ");
        QTest::newRow("nothing listening")
            << QByteArray("1\nPORT\n") << QByteArray()
            << QByteArray(", 303, socket_query, connect socket failed, code: 111, detail: Connection refused");
        QTest::newRow("closed without reply") << QByteArray("1\nPORT\n") << QByteArray("")
                                              << QByteArray(", 319, socket_query, receive message failed, code: ");
    }

    void query()
    {
        QFETCH(QByteArray, pidFile);
        QFETCH(QByteArray, answer);
        QFETCH(QByteArray, result);
        TestRoot root;
        Peer peer;
        if (!answer.isNull())
            peer.serve(answer);
        else
            peer.stop();
        if (!pidFile.isNull())
            QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"),
                QByteArray(pidFile).replace("PORT", QByteArray::number(peer.port))));

        const QByteArray request("\0\0\0\2{}", 6);
        unsigned char reply[64];
        memset(reply, 0x7f, sizeof(reply));
        const bool success = answer.size() > 4;
        QCOMPARE(socket_query(request.constData(), size_t(request.size()), reply, sizeof(reply)), success ? 1 : 0);
        if (success) {
            QCOMPARE(QByteArray(reinterpret_cast<char *>(reply), int(sizeof(reply))),
                result + QByteArray(int(sizeof(reply)) - result.size(), '\0'));
            QCOMPARE(peer.request(), request);
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
