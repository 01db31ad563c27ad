#include "common.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QTest>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>

namespace
{
// A one-shot peer on 127.0.0.1: takes one connection, keeps what it receives, answers with fixed bytes.
class OneShotPeer
{
public:
    explicit OneShotPeer(const QByteArray &answer)
    {
        m_listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in address {};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof(address);
        bind(m_listener, reinterpret_cast<sockaddr *>(&address), sizeof(address));
        listen(m_listener, 1);
        getsockname(m_listener, reinterpret_cast<sockaddr *>(&address), &length);
        m_port = ntohs(address.sin_port);
        m_thread = std::thread([this, answer]() {
            const int connection = accept(m_listener, nullptr, nullptr);
            if (connection < 0)
                return;
            char buffer[4096];
            const ssize_t got = recv(connection, buffer, sizeof(buffer), 0);
            if (got > 0)
                m_received = QByteArray(buffer, int(got));
            if (!answer.isEmpty())
                send(connection, answer.constData(), size_t(answer.size()), MSG_NOSIGNAL);
            close(connection);
        });
    }
    ~OneShotPeer()
    {
        shutdown(m_listener, SHUT_RDWR);
        if (m_thread.joinable())
            m_thread.join();
        close(m_listener);
    }
    quint16 port() const { return m_port; }
    QByteArray received()
    {
        if (m_thread.joinable())
            m_thread.join();
        return m_received;
    }

private:
    int m_listener = -1;
    quint16 m_port = 0;
    std::thread m_thread;
    QByteArray m_received;
};

quint16 closedPort()
{
    const int probe = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof(address);
    bind(probe, reinterpret_cast<sockaddr *>(&address), sizeof(address));
    getsockname(probe, reinterpret_cast<sockaddr *>(&address), &length);
    close(probe);
    return ntohs(address.sin_port);
}

bool writePidFile(const TestRoot &root, const QByteArray &content)
{
    return root.writeFile(QStringLiteral("/run/cache-kest.pid"), content);
}
} // namespace

class QueryClientTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void init() { SyslogCapture::clear(); }

    void readPort_data()
    {
        QTest::addColumn<QByteArray>("content");
        QTest::addColumn<bool>("ok");
        QTest::addColumn<int>("port");
        QTest::newRow("pid and port") << QByteArray("4711\n10080\n") << true << 10080;
        QTest::newRow("pid only") << QByteArray("4711\n") << true << 4711;
        QTest::newRow("carriage returns") << QByteArray("4711\r\n10080\r\n") << true << 10080;
        QTest::newRow("blank last line ignored") << QByteArray("4711\n10080\n\n") << true << 10080;
        QTest::newRow("one-digit last line without newline") << QByteArray("4711\n7") << true << 4711;
        QTest::newRow("not digits") << QByteArray("4711\n80a\n") << false << 0;
        QTest::newRow("wraps at 65536") << QByteArray("4711\n70000\n") << true << 4464;
        QTest::newRow("empty") << QByteArray("") << false << 0;
    }

    void readPort()
    {
        QFETCH(QByteArray, content);
        QFETCH(bool, ok);
        QFETCH(int, port);
        TestRoot root;
        QVERIFY(writePidFile(root, content));
        unsigned short read = 0;
        QCOMPARE(read_port(&read), ok ? 1 : 0);
        if (ok)
            QCOMPARE(int(read), port);
    }

    void replyBodyIsUnframed()
    {
        TestRoot root;
        OneShotPeer peer(QByteArray("\x00\x00\x00\x05hello", 9));
        QVERIFY(writePidFile(root, "1\n" + QByteArray::number(peer.port()) + "\n"));
        const QByteArray request("\x00\x00\x00\x02{}", 6);
        unsigned char reply[64];
        memset(reply, 0x7f, sizeof(reply));
        QCOMPARE(socket_query(request.constData(), size_t(request.size()), reply, sizeof(reply)), 1);
        QCOMPARE(QByteArray(reinterpret_cast<char *>(reply), 5), QByteArray("hello"));
        for (size_t i = 5; i < sizeof(reply); ++i)
            QCOMPARE(int(reply[i]), 0);
        QCOMPARE(peer.received(), request);
        QVERIFY(SyslogCapture::lines().isEmpty());
    }

    void failures_data()
    {
        QTest::addColumn<QByteArray>("pidFile"); // "PORT" is replaced by a port where nothing listens
        QTest::addColumn<QByteArray>("message");
        QTest::newRow("no pid file") << QByteArray() << QByteArray(", 297, socket_query, read port failed, code: ");
        QTest::newRow("port not digits") << QByteArray("1\n80a\n")
                                         << QByteArray(", 297, socket_query, read port failed, code: ");
        QTest::newRow("nothing listening")
            << QByteArray("1\nPORT\n")
            << QByteArray(", 303, socket_query, connect socket failed, code: 111, detail: Connection refused");
    }

    void failures()
    {
        QFETCH(QByteArray, pidFile);
        QFETCH(QByteArray, message);
        TestRoot root;
        if (!pidFile.isNull())
            QVERIFY(writePidFile(root, QByteArray(pidFile).replace("PORT", QByteArray::number(closedPort()))));
        unsigned char reply[64];
        QCOMPARE(socket_query("x", 1, reply, sizeof(reply)), 0);
        const QList<SyslogLine> lines = SyslogCapture::lines();
        QCOMPARE(lines.size(), 1);
        QCOMPARE(lines.first().priority, 3);
        QVERIFY2(lines.first().text.contains(", src/c-common/common" + message), lines.first().text.constData());
    }

    void peerClosesWithoutReply()
    {
        TestRoot root;
        OneShotPeer peer((QByteArray()));
        QVERIFY(writePidFile(root, "1\n" + QByteArray::number(peer.port()) + "\n"));
        unsigned char reply[64];
        QCOMPARE(socket_query("\x00\x00\x00\x00", 4, reply, sizeof(reply)), 0);
        QCOMPARE(SyslogCapture::count(", 319, socket_query, receive message failed, code: "), 1);
    }
};

QTEST_GUILESS_MAIN(QueryClientTest)
#include "test_queryclient.moc"
