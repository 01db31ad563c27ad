#include "messagehandler.h"
#include "syslogcapture.h"

#include <QTest>

class MessageHandlerTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void logged_data()
    {
        QTest::addColumn<int>("type");
        QTest::addColumn<QString>("message");
        QTest::addColumn<int>("priority");
        QTest::addColumn<QByteArray>("logged");
        QTest::newRow("debug") << int(QtDebugMsg) << QStringLiteral("plain") << 7 << QByteArray("plain");
        QTest::newRow("info") << int(QtInfoMsg) << QStringLiteral("first\nsecond") << 6 << QByteArray("first. second");
        QTest::newRow("warning") << int(QtWarningMsg) << QStringLiteral("a\r\nb") << 4 << QByteArray("a. . b");
        QTest::newRow("critical is 2") << int(QtCriticalMsg) << QStringLiteral("say \\\"hi\\\"") << 2
                                       << QByteArray("say hi");
        QTest::newRow("fatal is 3") << int(QtFatalMsg) << QStringLiteral("one\\ntwo") << 3 << QByteArray("one two");
        QTest::newRow("other is notice") << 42 << QStringLiteral("100% %s %n") << 5 << QByteArray("100% %s %n");
    }

    // Called directly: through qFatal, Qt itself would end the process after the handler.
    void logged()
    {
        QFETCH(int, type);
        QFETCH(QString, message);
        QFETCH(int, priority);
        QFETCH(QByteArray, logged);
        SyslogCapture::clear();
        messageHandler(QtMsgType(type), QMessageLogContext(), message);
        QCOMPARE(SyslogCapture::lines().size(), 1);
        QCOMPARE(SyslogCapture::lines().first().priority, priority);
        const QByteArray line = SyslogCapture::lines().first().text;
        QVERIFY2(QRegExp(QStringLiteral("cpu time: \\d+, ") + QRegExp::escape(QString::fromUtf8(logged)))
                     .exactMatch(QString::fromUtf8(line)),
            line);
    }
};

QTEST_GUILESS_MAIN(MessageHandlerTest)
#include "test_messagehandler.moc"
