#include "messagehandler.h"
#include "syslogcapture.h"

#include <QRegularExpression>
#include <QTest>

#include <syslog.h>

class MessageHandlerTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void init() { SyslogCapture::clear(); }

    void priorities_data()
    {
        QTest::addColumn<int>("type");
        QTest::addColumn<int>("priority");
        QTest::newRow("debug") << int(QtDebugMsg) << LOG_DEBUG;
        QTest::newRow("info") << int(QtInfoMsg) << LOG_INFO;
        QTest::newRow("warning") << int(QtWarningMsg) << LOG_WARNING;
        QTest::newRow("critical is 2") << int(QtCriticalMsg) << 2;
        QTest::newRow("fatal is 3") << int(QtFatalMsg) << 3;
        QTest::newRow("unknown") << 42 << LOG_NOTICE;
    }

    void priorities()
    {
        QFETCH(int, type);
        QFETCH(int, priority);
        // Called directly: through qFatal, Qt itself would end the process after the handler.
        messageHandler(QtMsgType(type), QMessageLogContext(), QStringLiteral("mapped"));
        const QList<SyslogLine> lines = SyslogCapture::lines();
        QCOMPARE(lines.size(), 1);
        QCOMPARE(lines.first().priority, priority);
    }

    void throughQtMessageFunctions()
    {
        qInstallMessageHandler(messageHandler);
        qWarning() << "warned";
        qCritical("critical %d", 7);
        qInfo().noquote() << QStringLiteral("informed");
        qInstallMessageHandler(nullptr);
        const QList<SyslogLine> lines = SyslogCapture::lines();
        QCOMPARE(lines.size(), 3);
        QCOMPARE(lines.at(0).priority, LOG_WARNING);
        QVERIFY(lines.at(0).text.endsWith(", warned"));
        QCOMPARE(lines.at(1).priority, 2);
        QVERIFY(lines.at(1).text.endsWith(", critical 7"));
        QCOMPARE(lines.at(2).priority, LOG_INFO);
        QVERIFY(lines.at(2).text.endsWith(", informed"));
    }

    void rewriting_data()
    {
        QTest::addColumn<QString>("message");
        QTest::addColumn<QByteArray>("logged");
        QTest::newRow("plain") << QStringLiteral("hello") << QByteArray("hello");
        QTest::newRow("newline") << QStringLiteral("first\nsecond") << QByteArray("first. second");
        QTest::newRow("carriage return") << QStringLiteral("a\r\nb") << QByteArray("a. . b");
        QTest::newRow("escaped quote") << QStringLiteral("say \\\"hi\\\"") << QByteArray("say hi");
        QTest::newRow("escaped newline") << QStringLiteral("one\\ntwo") << QByteArray("one two");
        QTest::newRow("percent stays literal") << QStringLiteral("100% %s %n") << QByteArray("100% %s %n");
        QTest::newRow("utf-8") << QStringLiteral("json\u683c\u5f0f") << QByteArray("json\xe6\xa0\xbc\xe5\xbc\x8f");
    }

    void rewriting()
    {
        QFETCH(QString, message);
        QFETCH(QByteArray, logged);
        messageHandler(QtWarningMsg, QMessageLogContext(), message);
        const QList<SyslogLine> lines = SyslogCapture::lines();
        QCOMPARE(lines.size(), 1);
        const QRegularExpression prefix(QStringLiteral("^cpu time: \\d+, "));
        const QString text = QString::fromUtf8(lines.first().text);
        const QRegularExpressionMatch match = prefix.match(text);
        QVERIFY2(match.hasMatch(), lines.first().text.constData());
        QCOMPARE(lines.first().text.mid(match.capturedLength()), logged);
    }
};

QTEST_GUILESS_MAIN(MessageHandlerTest)
#include "test_messagehandler.moc"
