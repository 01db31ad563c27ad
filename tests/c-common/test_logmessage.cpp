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
    QTemporaryFile files[2];
    int saved[2];
    for (int i = 0; i < 2; ++i) {
        files[i].open();
        saved[i] = dup(2 - i);
        dup2(files[i].handle(), 2 - i);
    }
    what();
    fflush(nullptr);
    QByteArrayList texts;
    for (int i = 0; i < 2; ++i) {
        dup2(saved[i], 2 - i);
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
} // namespace

class LogMessageTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void init() { SyslogCapture::clear(); }

    // One message at each level, with and without USER: the streams it reaches and its whole line.
    void logged_data()
    {
        QTest::addColumn<int>("level");
        QTest::addColumn<QByteArray>("logLevel"); // KEST_IAM_LOGLEVEL; null: unset
        QTest::addColumn<QByteArray>("user"); // null: unset
        QTest::addColumn<QByteArray>("sinks");
        const QByteArray alice("alice"), unset;
        QTest::newRow("error") << 3 << unset << alice << QByteArray("syslog stderr");
        QTest::newRow("warning, without USER") << 4 << unset << unset << QByteArray("syslog stderr");
        QTest::newRow("notice") << 5 << unset << alice << QByteArray("syslog");
        QTest::newRow("trace, variable unset") << 9 << unset << alice << QByteArray();
        QTest::newRow("trace, variable empty") << 8 << QByteArray("") << alice << QByteArray();
        QTest::newRow("trace, variable 0") << 9 << QByteArray("0") << unset << QByteArray("syslog stdout");
    }

    void logged()
    {
        QFETCH(int, level);
        QFETCH(QByteArray, logLevel);
        QFETCH(QByteArray, user);
        QFETCH(QByteArray, sinks);
        setEnv("USER", user);
        setEnv("KEST_IAM_LOGLEVEL", logLevel);
        // A body that printf would take for conversions once it were used as a format.
        const QByteArrayList streams = streamed(
            [level] { log_message(level, "src/c-common/common", 273, "is_connect", "%d%% %s", 100, "%n sure"); });
        const QList<SyslogLine> lines = SyslogCapture::lines();
        QCOMPARE(lines.size(), sinks.contains("syslog") ? 1 : 0);
        const QByteArray line = lines.isEmpty() ? QByteArray() : lines.first().text;
        QCOMPARE(streams,
            QByteArrayList(
                { sinks.contains("stderr") ? line + '\n' : "", sinks.contains("stdout") ? line + '\n' : "" }));
        if (lines.isEmpty())
            return;
        QCOMPARE(lines.first().priority, level);
        QVERIFY2(QRegExp(QStringLiteral("\\d{4}-\\d\\d-\\d\\d \\d\\d:\\d\\d:\\d\\d"))
                     .exactMatch(QString::fromLatin1(line.left(19))),
            line);
        // Without USER the ids stand alone, and the line ends in two spaces.
        const QByteArray ids = QString::asprintf("%u,%u, %u,%u", getuid(), geteuid(), getgid(), getegid()).toLatin1();
        QCOMPARE(line.mid(19),
            " process: test_logmessage(" + QByteArray::number(getpid())
                + "), user: " + (user.isNull() ? ids + ", " : user + '(' + ids + "), ")
                + "src/c-common/common, 273, is_connect, 100% %n sure " + (user.isNull() ? " " : ""));
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
