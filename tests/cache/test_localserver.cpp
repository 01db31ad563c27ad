#include "cachedaemonfixture.h"
#include "rawconnection.h"
#include "testroot.h"

#include <QElapsedTimer>
#include <QTest>

namespace
{
QByteArray errorReply(const char *text)
{
    return R"({"errorInfo":")" + QByteArray(text) + R"(","version":16777216})";
}
const QByteArray jsonError = errorReply("Error in JSON data !!!");
const QByteArray missingField
    = errorReply("The JSON field is missing. version, functionName and argv are required !!!");
QByteArray result(const char *text)
{
    return R"({"errorMessage":")" + QByteArray(text) + R"(","retVal":1})";
}
const QByteArray passFalse = R"({"pass":false})";
// Expected in place of a reply: none within 400 ms, the connection closed, or the client going away itself.
const QByteArray noReply = "(none)", closed = "(closed)", vanish = "(vanish)";
const QByteArray settings = "[main]\nenable=true\nip=127.0.0.2\nport=0\nnetwork-timeout=1\n";
} // namespace

// The daemon with the domain server out of reach: every answer here comes from the request server.
class LocalServerTest : public QObject
{
    Q_OBJECT

private:
    TestRoot m_root;
    CacheDaemonFixture m_daemon;
    QScopedPointer<RawConnection> m_stale, m_idle;
    QElapsedTimer m_staleSince;

private Q_SLOTS:
    void initTestCase()
    {
        // Port 0: the daemon takes a free port, and the domain server at 127.0.0.2:0 never answers.
        QVERIFY(m_root.writeSettings(settings));
        QVERIFY2(m_daemon.start(), qPrintable(m_daemon.errorText()));
        m_stale.reset(new RawConnection(m_daemon.port()));
        m_stale->send(QByteArray::fromHex("00000010") + "{\"vers");
        m_staleSince.start();
        m_idle.reset(new RawConnection(m_daemon.port()));
    }

    void exchanges_data()
    {
        // Bytes to send, each followed by the reply expected next.
        QTest::addColumn<QByteArrayList>("steps");
        const auto frame = &CacheDaemonFixture::frame;
        const auto row = [frame](const char *name, const char *payload, const QByteArray &reply) {
            QTest::newRow(name) << QByteArrayList { frame(payload), reply };
        };
        row("not JSON", "hello", jsonError);
        row("JSON array", "[1,2]", jsonError);
        row("no version", R"({"functionName":"queryUid","argv":["1000"]})", missingField);
        row("two arguments for queryUid", R"({"version":1,"functionName":"queryUid","argv":["1000","x"]})",
            errorReply("Error in JSON argv array (all array members must be strings) !!!"));
        row("letter case", R"({"version":1,"functionName":"QueryUid","argv":["1000"]})",
            errorReply("Function name not defined !!!"));
        row("command wins", R"({"command":9,"data":{},"functionName":"queryUid","argv":["1"]})",
            result("invalid command!!!"));
        row("command without data", R"({"command":1})",
            result("The JSON field is missing. command and data are required !!!"));
        row("queryGid never served", R"({"version":1,"functionName":"queryGid","argv":["1000","{}"]})", passFalse);
        const QByteArray empty = frame("{}");
        QTest::newRow("empty frame waits for more bytes")
            << QByteArrayList { QByteArray(4, '\0'), noReply, empty, jsonError, QByteArray(1, ' '), missingField };
        QTest::newRow("split frame") << QByteArrayList { empty.left(3), noReply, empty.mid(3, 2), noReply, empty.mid(5),
            missingField };
        QTest::newRow("two frames in one segment, one per read")
            << QByteArrayList { frame("[]") + empty, jsonError, QByteArray(), noReply, frame("1"), missingField };
        QTest::newRow("frame above 1 MiB") << QByteArrayList { QByteArray::fromHex("00100001") + "{",
            errorReply("Frame too large !!!"), QByteArray(), closed };
        QTest::newRow("frame of 1 MiB") << QByteArrayList { frame(QByteArray(1024 * 1024, ' ')), jsonError };
        row("client gone before its answer", R"({"version":1,"functionName":"authenticatePassword","argv":["@a","p"]})",
            vanish);
    }

    void exchanges()
    {
        QFETCH(QByteArrayList, steps);
        RawConnection connection(m_daemon.port());
        for (int i = 0; i < steps.size(); i += 2) {
            connection.send(steps.at(i));
            const QByteArray &expected = steps.at(i + 1);
            if (expected == vanish)
                connection.abort();
            else if (expected == closed)
                QVERIFY(connection.closedWithin(5000));
            else
                QCOMPARE(
                    connection.reply(expected == noReply ? 400 : 20000), expected == noReply ? QByteArray() : expected);
        }
    }

    // No client, however it behaves, stops the server or closes another one's connection.
    void cleanup()
    {
        QCOMPARE(m_daemon.call(QStringLiteral("queryUid"), { QStringLiteral("12") }), passFalse);
        QVERIFY(m_idle->isConnected() && m_daemon.isRunning());
    }

    // Switched off, the daemon says no even to requests it would otherwise answer or reject.
    void disabledAnswersFalse()
    {
        QVERIFY(m_root.writeSettings("[main]\nenable=false\nip=127.0.0.2\nport=0\n"));
        const QByteArray replies = m_daemon.call(QStringLiteral("modifyUser"), { QStringLiteral("not json") })
            + m_daemon.call(QStringLiteral("listAccounts"), {});
        QVERIFY(m_root.writeSettings(settings));
        QCOMPARE(replies, passFalse + passFalse);
    }

    // Last: a frame left incomplete is closed after 30 s; a connection that holds no bytes is not (cleanup).
    void staleFrameIsClosed()
    {
        QVERIFY(!m_stale->closedWithin(int(qMax<qint64>(0, 25000 - m_staleSince.elapsed()))));
        QVERIFY(m_stale->closedWithin(10000));
    }

    void cleanupTestCase()
    {
        QCOMPARE(m_daemon.stop(), 0);
        QVERIFY(!QFile::exists(m_root.filePath(QStringLiteral("/run/cache-kest.pid"))));
    }
};

QTEST_GUILESS_MAIN(LocalServerTest)
#include "test_localserver.moc"
