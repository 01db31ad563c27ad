#include "cachedaemonfixture.h"
#include "rawconnection.h"
#include "testroot.h"

#include <QTest>

// A connection that never completes its frame is closed after 30 s; its own test program so that
// the wait runs beside the other tests.
class PartialFrameTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void staleFrameIsClosed()
    {
        TestRoot root;
        QVERIFY(root.writeSettings("[main]\nenable=true\nip=127.0.0.2\nport=0\n"));
        CacheDaemonFixture daemon;
        QVERIFY2(daemon.start(), qPrintable(daemon.errorText()));

        RawConnection stale(daemon.port());
        stale.send(QByteArray::fromHex("00000010") + "{\"vers");
        RawConnection idle(daemon.port());

        QVERIFY(!stale.closedWithin(25000));
        QVERIFY(stale.closedWithin(10000));
        // A connection that holds no bytes at all is not a partial frame.
        QVERIFY(idle.isConnected());
        QCOMPARE(daemon.call(QStringLiteral("queryGid"), { QStringLiteral("1"), QStringLiteral("{}") }),
            QByteArray(R"({"pass":false})"));
    }
};

QTEST_GUILESS_MAIN(PartialFrameTest)
#include "test_partialframe.moc"
