#include "cachedaemonfixture.h"
#include "localservertestsupport.h"
#include "testroot.h"

#include <QRandomGenerator>
#include <QTest>

namespace
{
const QByteArray jsonError = R"({"errorInfo":"Error in JSON data !!!","version":16777216})";
const QByteArray missingField
    = R"({"errorInfo":"The JSON field is missing. version, functionName and argv are required !!!","version":16777216})";
const QByteArray argvError
    = R"({"errorInfo":"Error in JSON argv array (all array members must be strings) !!!","version":16777216})";
const QByteArray unknownFunction = R"({"errorInfo":"Function name not defined !!!","version":16777216})";
const QByteArray passFalse = R"({"pass":false})";
} // namespace

// The daemon with the domain server out of reach: every answer here comes from the request server.
class LocalServerTest : public QObject
{
    Q_OBJECT

private:
    TestRoot *m_root = nullptr;
    CacheDaemonFixture *m_daemon = nullptr;

    QByteArray roundTrip(const QByteArray &payload)
    {
        RawConnection connection(m_daemon->port());
        connection.send(CacheDaemonFixture::frame(payload));
        return connection.reply();
    }

private Q_SLOTS:
    void initTestCase()
    {
        m_root = new TestRoot;
        // Port 0: the daemon takes a free port, and the domain server at 127.0.0.2:0 never answers.
        QVERIFY(m_root->writeSettings("[main]\nenable=true\nip=127.0.0.2\nport=0\nnetwork-timeout=1\n"));
        m_daemon = new CacheDaemonFixture;
        QVERIFY2(m_daemon->start(), qPrintable(m_daemon->errorText()));
    }

    void cleanupTestCase()
    {
        if (m_daemon)
            QCOMPARE(m_daemon->stop(), 0);
        delete m_daemon;
        QVERIFY(!QFile::exists(m_root->filePath(QStringLiteral("/run/cache-kest.pid"))));
        delete m_root;
    }

    void replies_data()
    {
        QTest::addColumn<QByteArray>("payload");
        QTest::addColumn<QByteArray>("expected");

        QTest::newRow("not JSON") << QByteArray("hello") << jsonError;
        QTest::newRow("JSON array") << QByteArray("[1,2]") << jsonError;
        QTest::newRow("half an object") << QByteArray("{\"version\":") << jsonError;
        QTest::newRow("empty object") << QByteArray("{}") << missingField;
        QTest::newRow("no version") << QByteArray(R"({"functionName":"queryUid","argv":["1000"]})") << missingField;
        QTest::newRow("no argv") << QByteArray(R"({"version":1,"functionName":"queryUid"})") << missingField;
        QTest::newRow("two arguments for queryUid")
            << QByteArray(R"({"version":1,"functionName":"queryUid","argv":["1000","x"]})") << argvError;
        QTest::newRow("argv not an array")
            << QByteArray(R"({"version":1,"functionName":"queryUid","argv":"1000"})") << argvError;
        QTest::newRow("letter case") << QByteArray(R"({"version":1,"functionName":"QueryUid","argv":["1000"]})")
                                     << unknownFunction;
        QTest::newRow("unknown function")
            << QByteArray(R"({"version":1,"functionName":"dropAll","argv":[]})") << unknownFunction;
        QTest::newRow("command wins over functionName")
            << QByteArray(R"({"command":9,"data":{},"version":1,"functionName":"queryUid","argv":["1"]})")
            << QByteArray(R"({"errorMessage":"invalid command!!!","retVal":1})");
        QTest::newRow("command without data")
            << QByteArray(R"({"command":1})")
            << QByteArray(
                   R"({"errorMessage":"The JSON field is missing. command and data are required !!!","retVal":1})");
        QTest::newRow("queryGid never served") << CacheDaemonFixture::functionCall(
            QStringLiteral("queryGid"), { QStringLiteral("1000"), QStringLiteral("{}") })
                                               << passFalse;
        QTest::newRow("queryGroupName never served") << CacheDaemonFixture::functionCall(
            QStringLiteral("queryGroupName"), { QStringLiteral("sudo"), QStringLiteral("{}") })
                                                     << passFalse;
        QTest::newRow("unknown account offline") << CacheDaemonFixture::functionCall(QStringLiteral("queryAccountName"),
            { QStringLiteral("@nobody") }) << passFalse;
        QTest::newRow("indented request")
            << QByteArray("{\n  \"version\": 1,\n  \"functionName\": \"queryUid\",\n  \"argv\": [\"4\"]\n}")
            << passFalse;
    }

    void replies()
    {
        QFETCH(QByteArray, payload);
        QFETCH(QByteArray, expected);
        QCOMPARE(roundTrip(payload), expected);
    }

    void connectionStaysOpenAfterErrors()
    {
        RawConnection connection(m_daemon->port());
        connection.send(CacheDaemonFixture::frame("garbage"));
        QCOMPARE(connection.reply(), jsonError);
        connection.send(CacheDaemonFixture::frame("{}"));
        QCOMPARE(connection.reply(), missingField);
        QVERIFY(connection.isConnected());
    }

    void emptyFrameWaitsForMoreBytes()
    {
        RawConnection connection(m_daemon->port());
        connection.send(QByteArray(4, '\0'));
        QVERIFY(connection.reply(500).isNull());
        // The next bytes make the empty frame readable; the new frame itself waits for another signal.
        connection.send(CacheDaemonFixture::frame("{}"));
        QCOMPARE(connection.reply(), jsonError);
        QVERIFY(connection.reply(500).isNull());
        connection.send(QByteArray(1, ' '));
        QCOMPARE(connection.reply(), missingField);
    }

    void splitFrameIsTakenWhole()
    {
        const QByteArray framed = CacheDaemonFixture::frame("{}");
        RawConnection connection(m_daemon->port());
        connection.send(framed.left(3));
        QVERIFY(connection.reply(300).isNull());
        connection.send(framed.mid(3, 2));
        QVERIFY(connection.reply(300).isNull());
        connection.send(framed.mid(5));
        QCOMPARE(connection.reply(), missingField);
    }

    void twoFramesInOneSegment()
    {
        RawConnection connection(m_daemon->port());
        connection.send(CacheDaemonFixture::frame("[]") + CacheDaemonFixture::frame("{}"));
        QCOMPARE(connection.reply(), jsonError);
        QVERIFY(connection.reply(500).isNull());
        connection.send(CacheDaemonFixture::frame("1"));
        QCOMPARE(connection.reply(), missingField);
        QVERIFY(connection.reply(300).isNull());
        connection.send(CacheDaemonFixture::frame("[]"));
        QCOMPARE(connection.reply(), jsonError);
    }

    void oversizedFrameIsRefused()
    {
        RawConnection connection(m_daemon->port());
        QByteArray prefix(4, '\0');
        qToBigEndian<quint32>(1024 * 1024 + 1, prefix.data());
        connection.send(prefix + "{");
        QCOMPARE(connection.reply(), QByteArray(R"({"errorInfo":"Frame too large !!!","version":16777216})"));
        QVERIFY(connection.closedWithin(5000));

        // The largest allowed frame is still read.
        RawConnection large(m_daemon->port());
        large.send(CacheDaemonFixture::frame(QByteArray(1024 * 1024, ' ')));
        QCOMPARE(large.reply(), jsonError);
    }

    void badClientsDoNotStopTheServer()
    {
        RawConnection silent(m_daemon->port());
        RawConnection partial(m_daemon->port());
        partial.send(QByteArray::fromHex("000000ff") + "{\"version\"");
        RawConnection random(m_daemon->port());
        QByteArray noise(4096, '\0');
        for (char &byte : noise)
            byte = char(QRandomGenerator::global()->bounded(256));
        noise[0] = 0; // keeps the announced length under the frame cap
        random.send(noise);
        RawConnection vanishing(m_daemon->port());
        vanishing.send(CacheDaemonFixture::frame(CacheDaemonFixture::functionCall(
            QStringLiteral("authenticatePassword"), { QStringLiteral("@a"), QStringLiteral("pw") })));
        vanishing.abort();

        QCOMPARE(roundTrip(CacheDaemonFixture::functionCall(QStringLiteral("queryUid"), { QStringLiteral("12") })),
            passFalse);
        QVERIFY(silent.isConnected());
        QVERIFY(m_daemon->isRunning());
    }

    void disabledAnswersFalse_data()
    {
        QTest::addColumn<QString>("function");
        QTest::addColumn<QStringList>("argv");
        QTest::newRow("queryAccountName")
            << QStringLiteral("queryAccountName") << QStringList { QStringLiteral("@alice") };
        QTest::newRow("queryUid") << QStringLiteral("queryUid") << QStringList { QStringLiteral("10001") };
        QTest::newRow("authenticatePassword")
            << QStringLiteral("authenticatePassword") << QStringList { QStringLiteral("@alice"), QStringLiteral("x") };
        QTest::newRow("modifyUser") << QStringLiteral("modifyUser") << QStringList { QStringLiteral("not json") };
    }

    void disabledAnswersFalse()
    {
        QFETCH(QString, function);
        QFETCH(QStringList, argv);
        QVERIFY(m_root->writeSettings("[main]\nenable=false\nip=127.0.0.2\nport=0\n"));
        const QByteArray reply = m_daemon->call(function, argv);
        QVERIFY(m_root->writeSettings("[main]\nenable=true\nip=127.0.0.2\nport=0\nnetwork-timeout=1\n"));
        QCOMPARE(reply, passFalse);
    }
};

QTEST_GUILESS_MAIN(LocalServerTest)
#include "test_localserver.moc"
