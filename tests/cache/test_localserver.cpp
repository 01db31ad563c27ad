#include "cachedaemonfixture.h"
#include "rawconnection.h"
#include "testroot.h"

#include <QElapsedTimer>
#include <QRandomGenerator>
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
const QByteArray noReply = "(none)";
const QByteArray closed = "(closed)";
const QByteArray settings = "[main]\nenable=true\nip=127.0.0.2\nport=0\nnetwork-timeout=1\n";

QByteArray call(const char *name, const QStringList &argv)
{
    return CacheDaemonFixture::functionCall(QLatin1String(name), argv);
}
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
        // Bytes to send, each followed by the reply expected next: noReply within 400 ms, or closed.
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
    }

    void exchanges()
    {
        QFETCH(QByteArrayList, steps);
        RawConnection connection(m_daemon.port());
        for (int i = 0; i < steps.size(); i += 2) {
            connection.send(steps.at(i));
            const QByteArray &expected = steps.at(i + 1);
            if (expected == closed)
                QVERIFY(connection.closedWithin(5000));
            else
                QCOMPARE(
                    connection.reply(expected == noReply ? 400 : 20000), expected == noReply ? QByteArray() : expected);
        }
    }

    void badClientsDoNotStopTheServer()
    {
        RawConnection partial(m_daemon.port());
        partial.send(QByteArray::fromHex("000000ff") + "{\"version\"");
        RawConnection random(m_daemon.port());
        QByteArray noise(4096, '\0');
        for (int i = 1; i < noise.size(); ++i) // a zero first byte keeps the announced length under the cap
            noise[i] = char(QRandomGenerator::global()->bounded(256));
        random.send(noise);
        RawConnection vanishing(m_daemon.port());
        vanishing.send(
            CacheDaemonFixture::frame(call("authenticatePassword", { QStringLiteral("@a"), QStringLiteral("pw") })));
        vanishing.abort();
        QCOMPARE(m_daemon.request(call("queryUid", { QStringLiteral("12") })), passFalse);
        QVERIFY(m_idle->isConnected() && m_daemon.isRunning());
    }

    void disabledAnswersFalse()
    {
        QVERIFY(m_root.writeSettings("[main]\nenable=false\nip=127.0.0.2\nport=0\n"));
        for (const QByteArray &request :
            { call("queryAccountName", { QStringLiteral("@alice") }), call("queryUid", { QStringLiteral("10001") }),
                call("authenticatePassword", { QStringLiteral("@alice"), QStringLiteral("x") }),
                call("modifyUser", { QStringLiteral("not json") }), call("listAccounts", {}) })
            QCOMPARE(m_daemon.request(request), passFalse);
        QVERIFY(m_root.writeSettings(settings));
    }

    // Last: a frame left incomplete is closed after 30 s; a connection that holds no bytes is not.
    void staleFrameIsClosed()
    {
        QVERIFY(!m_stale->closedWithin(int(qMax<qint64>(0, 25000 - m_staleSince.elapsed()))));
        QVERIFY(m_stale->closedWithin(10000));
        QVERIFY(m_idle->isConnected());
    }

    void cleanupTestCase()
    {
        QCOMPARE(m_daemon.stop(), 0);
        QVERIFY(!QFile::exists(m_root.filePath(QStringLiteral("/run/cache-kest.pid"))));
    }
};

QTEST_GUILESS_MAIN(LocalServerTest)
#include "test_localserver.moc"
