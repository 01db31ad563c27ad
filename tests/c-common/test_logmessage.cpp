#include "common.h"
#include "syslogcapture.h"

#include <QTemporaryFile>
#include <QTest>

#include <functional>
#include <unistd.h>

namespace
{
// Runs what with stderr and stdout sent to files; returns what each of the two received.
QByteArrayList streamed(const std::function<void()> &what)
{
    FILE *const streams[] = { stderr, stdout };
    QTemporaryFile files[2];
    int saved[2];
    for (int i = 0; i < 2; ++i) {
        files[i].open();
        saved[i] = dup(fileno(streams[i]));
        dup2(files[i].handle(), fileno(streams[i]));
    }
    what();
    QByteArrayList texts;
    for (int i = 0; i < 2; ++i) {
        fflush(streams[i]);
        dup2(saved[i], fileno(streams[i]));
        close(saved[i]);
        files[i].seek(0);
        texts << files[i].readAll();
    }
    return texts;
}

void setEnv(const char *name, const QByteArray &value)
{
    value.isNull() ? qunsetenv(name) : qputenv(name, value);
}

QByteArray ids()
{
    return QByteArray::number(getuid()) + ',' + QByteArray::number(geteuid()) + ", " + QByteArray::number(getgid())
        + ',' + QByteArray::number(getegid());
}
} // namespace

class LogMessageTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void init() { SyslogCapture::clear(); }

    void lineLayout_data()
    {
        QTest::addColumn<QByteArray>("user");
        QTest::addColumn<QByteArray>("tail");
        QTest::newRow("with USER") << QByteArray("alice")
                                   << "user: alice(" + ids() + "), src/c-common/common, 273, is_connect, 100% %n sure ";
        QTest::newRow("without USER") << QByteArray()
                                      << "user: " + ids() + ", src/c-common/common, 273, is_connect, 100% %n sure  ";
    }

    void lineLayout()
    {
        QFETCH(QByteArray, user);
        QFETCH(QByteArray, tail);
        setEnv("USER", user);
        const QByteArrayList streams
            = streamed([] { log_message(3, "src/c-common/common", 273, "is_connect", "%d%% %s", 100, "%n sure"); });
        const QList<SyslogLine> lines = SyslogCapture::lines();
        QCOMPARE(lines.size(), 1);
        QCOMPARE(lines.first().priority, 3);
        const QByteArray line = lines.first().text;
        QVERIFY2(QRegExp(QStringLiteral("\\d{4}-\\d\\d-\\d\\d \\d\\d:\\d\\d:\\d\\d"))
                     .exactMatch(QString::fromLatin1(line.left(19))),
            line);
        QCOMPARE(line.mid(19), " process: test_logmessage(" + QByteArray::number(getpid()) + "), " + tail);
        QCOMPARE(streams, QByteArrayList({ line + '\n', QByteArray() }));
    }

    void levels_data()
    {
        QTest::addColumn<int>("level");
        QTest::addColumn<QByteArray>("logLevel");
        QTest::addColumn<QByteArray>("sinks");
        QTest::newRow("warning") << 4 << QByteArray() << QByteArray("syslog stderr");
        QTest::newRow("notice") << 5 << QByteArray() << QByteArray("syslog");
        QTest::newRow("trace, variable unset") << 9 << QByteArray() << QByteArray();
        QTest::newRow("trace, variable empty") << 8 << QByteArray("") << QByteArray();
        QTest::newRow("trace, variable 0") << 9 << QByteArray("0") << QByteArray("syslog stdout");
    }

    void levels()
    {
        QFETCH(int, level);
        QFETCH(QByteArray, logLevel);
        QFETCH(QByteArray, sinks);
        setEnv("KEST_IAM_LOGLEVEL", logLevel);
        const QByteArrayList streams = streamed([level] { log_message(level, "file", 1, "function", "level test"); });
        qunsetenv("KEST_IAM_LOGLEVEL");
        QCOMPARE(streams.first().contains("level test"), sinks.contains("stderr"));
        QCOMPARE(streams.last().contains("level test"), sinks.contains("stdout"));
        QCOMPARE(SyslogCapture::count("level test"), sinks.contains("syslog") ? 1 : 0);
        if (sinks.contains("syslog"))
            QCOMPARE(SyslogCapture::lines().first().priority, level);
    }

    void nullArgumentsAndLimits()
    {
        log_message(3, nullptr, 1, "function", "text");
        log_message(3, "file", 1, nullptr, "text");
        log_message(3, "file", 1, "function", nullptr);
        QVERIFY(SyslogCapture::lines().isEmpty());

        const QByteArray body(20000, 'a');
        log_message(6, "file", 1, "function", "%s", body.constData());
        QVERIFY(SyslogCapture::lines().first().text.contains(QByteArray(8189, 'a') + ' '));
        QVERIFY(!SyslogCapture::lines().first().text.contains(QByteArray(8190, 'a')));
    }
};

QTEST_GUILESS_MAIN(LogMessageTest)
#include "test_logmessage.moc"
