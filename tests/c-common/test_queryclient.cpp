#include "common.h"
#include "loopbackpeer.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QFile>
#include <QProcess>
#include <QTest>

class QueryClientTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void init() { SyslogCapture::clear(); }

    // What each reader of the pid file makes of it: "exists pid running port daemonPort", "-" where one fails.
    void pidFile_data()
    {
        QTest::addColumn<QString>("process"); // a sleeper's name; its pid stands for PID
        QTest::addColumn<QByteArray>("content");
        QTest::addColumn<QByteArray>("expected");
        QTest::newRow("cache-kest, port wraps")
            << QStringLiteral("cache-kest") << QByteArray("PID\n70000\n") << QByteArray("1 PID 1 4464 4464");
        QTest::newRow("pid now used by another program")
            << QStringLiteral("cache-kest-old") << QByteArray("PID\n10080\n") << QByteArray("1 PID 0 10080 -");
        QTest::newRow("no such process, CRLF, blank last line")
            << QString() << QByteArray("999999999\r\n10080\r\n\n") << QByteArray("1 999999999 0 10080 -");
        QTest::newRow("port not digits") << QString() << QByteArray("999999999\n80a\n")
                                         << QByteArray("1 999999999 0 - -");
        QTest::newRow("blank first line") << QString() << QByteArray("\n10080\n") << QByteArray("1 - 0 10080 -");
        QTest::newRow("empty") << QString() << QByteArray("") << QByteArray("0 - 0 - -");
    }

    void pidFile()
    {
        QFETCH(QString, process);
        QFETCH(QByteArray, content);
        QFETCH(QByteArray, expected);
        TestRoot root;
        QProcess sleeper;
        if (!process.isEmpty()) {
            // Through a link: the sleeper's first argument is a longer path that ends in that name.
            QVERIFY(QFile::link(QStringLiteral("/bin/sleep"), root.filePath(QLatin1Char('/') + process)));
            sleeper.start(root.filePath(QLatin1Char('/') + process), { QStringLiteral("30") });
            QVERIFY(sleeper.waitForStarted());
        }
        const QByteArray pid = QByteArray::number(sleeper.processId());
        QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"), content.replace("PID", pid)));
        char pidText[64];
        unsigned short port = 0, daemonPort = 0;
        const bool pidRead = read_pid_file(pidText), portRead = read_port(&port);
        const QByteArrayList seen { QByteArray::number(pid_file_exists()), pidRead ? QByteArray(pidText) : "-",
            QByteArray::number(is_cache_daemon_running()), portRead ? QByteArray::number(port) : "-",
            cache_daemon_port(&daemonPort) ? QByteArray::number(daemonPort) : "-" };
        QCOMPARE(seen.join(' '), expected.replace("PID", pid));
        sleeper.kill();
        sleeper.waitForFinished();
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
