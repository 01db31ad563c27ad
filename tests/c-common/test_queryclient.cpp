#include "common.h"
#include "loopbackpeer.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QTest>

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
        LoopbackPeer peer(answer.isNull() ? QList<QByteArray>() : QList<QByteArray> { answer });
        if (answer.isNull())
            peer.finish();
        if (pidFile)
            QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"), "1\n" + QByteArray::number(peer.port())));

        const QByteArray request("\0\0\0\2{}", 6);
        QByteArray reply(64, 0x7f);
        const bool success = answer.size() > 4;
        QCOMPARE(socket_query(request.constData(), size_t(request.size()),
                     reinterpret_cast<unsigned char *>(reply.data()), size_t(reply.size())),
            success ? 1 : 0);
        const QList<QByteArray> received = peer.finish();
        if (success) {
            QCOMPARE(reply, result + QByteArray(reply.size() - result.size(), '\0'));
            QCOMPARE(received, QList<QByteArray> { request });
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
