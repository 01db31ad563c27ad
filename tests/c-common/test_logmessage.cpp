#include "common.h"
#include "syslogcapture.h"

#include <QRegularExpression>
#include <QTemporaryFile>
#include <QTest>

#include <cstdio>
#include <syslog.h>
#include <unistd.h>

namespace {
// Captures what one stream receives while it lives.
class StreamCapture
{
public:
    explicit StreamCapture(FILE *stream)
        : m_stream(stream)
        , m_fd(fileno(stream))
    {
        m_file.open();
        fflush(m_stream);
        m_saved = dup(m_fd);
        dup2(m_file.handle(), m_fd);
    }
    ~StreamCapture() { restore(); }

    QByteArray text()
    {
        restore();
        m_file.seek(0);
        return m_file.readAll();
    }

private:
    void restore()
    {
        if (m_saved < 0)
            return;
        fflush(m_stream);
        dup2(m_saved, m_fd);
        close(m_saved);
        m_saved = -1;
    }

    FILE *m_stream;
    int m_fd;
    int m_saved = -1;
    QTemporaryFile m_file;
};

void setEnv(const char *name, const QByteArray &value)
{
    if (value.isNull())
        qunsetenv(name);
    else
        qputenv(name, value);
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
        QTest::addColumn<QByteArray>("expectedUserPart");
        QTest::addColumn<QByteArray>("expectedEnd");

        QTest::newRow("with USER") << QByteArray("alice") << QByteArray("user: alice(" + ids() + ")")
                                   << QByteArray(", src/c-common/common, 273, is_connect, body text ");
        QTest::newRow("without USER") << QByteArray() << QByteArray("user: " + ids())
                                      << QByteArray(", src/c-common/common, 273, is_connect, body text  ");
    }

    void lineLayout()
    {
        QFETCH(QByteArray, user);
        QFETCH(QByteArray, expectedUserPart);
        QFETCH(QByteArray, expectedEnd);

        const QByteArray savedUser = qgetenv("USER");
        const bool hadUser = qEnvironmentVariableIsSet("USER");
        setEnv("USER", user);
        StreamCapture error(stderr);
        log_message(3, "src/c-common/common", 273, "is_connect", "body %s", "text");
        const QByteArray streamed = error.text();
        setEnv("USER", hadUser ? savedUser : QByteArray());

        const QList<SyslogLine> lines = SyslogCapture::lines();
        QCOMPARE(lines.size(), 1);
        QCOMPARE(lines.first().priority, 3);
        const QByteArray line = lines.first().text;
        const QByteArray head = " process: test_logmessage(" + QByteArray::number(getpid()) + "), ";
        const QRegularExpression stamp(QStringLiteral("^\\d{4}-\\d\\d-\\d\\d \\d\\d:\\d\\d:\\d\\d$"));
        QVERIFY2(stamp.match(QString::fromLatin1(line.left(19))).hasMatch(), line.constData());
        QCOMPARE(line.mid(19, head.size()), head);
        QCOMPARE(line.mid(19 + head.size(), expectedUserPart.size()), expectedUserPart);
        QVERIFY2(line.endsWith(expectedEnd), line.constData());
        QCOMPARE(line.size(), 19 + head.size() + expectedUserPart.size() + expectedEnd.size());
        QCOMPARE(streamed, line + '\n');
    }

    void levels_data()
    {
        QTest::addColumn<int>("level");
        QTest::addColumn<QByteArray>("logLevelEnv");
        QTest::addColumn<bool>("toSyslog");
        QTest::addColumn<bool>("toStderr");
        QTest::addColumn<bool>("toStdout");

        QTest::newRow("error") << 3 << QByteArray() << true << true << false;
        QTest::newRow("warning") << 4 << QByteArray() << true << true << false;
        QTest::newRow("notice") << 5 << QByteArray() << true << false << false;
        QTest::newRow("info") << 6 << QByteArray() << true << false << false;
        QTest::newRow("debug") << 7 << QByteArray() << true << false << false;
        QTest::newRow("trace without variable") << 9 << QByteArray() << false << false << false;
        QTest::newRow("trace with empty variable") << 9 << QByteArray("") << false << false << false;
        QTest::newRow("trace with 0") << 9 << QByteArray("0") << true << false << true;
        QTest::newRow("trace 8 with variable") << 8 << QByteArray("debug") << true << false << true;
    }

    void levels()
    {
        QFETCH(int, level);
        QFETCH(QByteArray, logLevelEnv);
        QFETCH(bool, toSyslog);
        QFETCH(bool, toStderr);
        QFETCH(bool, toStdout);

        setEnv("KEST_IAM_LOGLEVEL", logLevelEnv);
        StreamCapture error(stderr);
        StreamCapture output(stdout);
        log_message(level, "file", 1, "function", "level test");
        const QByteArray errorText = error.text();
        const QByteArray outputText = output.text();
        qunsetenv("KEST_IAM_LOGLEVEL");

        QCOMPARE(SyslogCapture::count("level test"), toSyslog ? 1 : 0);
        if (toSyslog)
            QCOMPARE(SyslogCapture::lines().first().priority, level);
        QCOMPARE(errorText.contains("level test"), toStderr);
        QCOMPARE(outputText.contains("level test"), toStdout);
    }

    void nullArgumentsSuppress_data()
    {
        QTest::addColumn<bool>("nullFile");
        QTest::addColumn<bool>("nullFunction");
        QTest::addColumn<bool>("nullFormat");
        QTest::newRow("file") << true << false << false;
        QTest::newRow("function") << false << true << false;
        QTest::newRow("format") << false << false << true;
    }

    void nullArgumentsSuppress()
    {
        QFETCH(bool, nullFile);
        QFETCH(bool, nullFunction);
        QFETCH(bool, nullFormat);
        StreamCapture error(stderr);
        log_message(3, nullFile ? nullptr : "file", 1, nullFunction ? nullptr : "function",
                    nullFormat ? nullptr : "text");
        QVERIFY(error.text().isEmpty());
        QVERIFY(SyslogCapture::lines().isEmpty());
    }

    void percentSignsStayLiteral()
    {
        qputenv("USER", "tester");
        StreamCapture error(stderr);
        log_message(3, "file", 1, "function", "user said %s", "100% %n %s sure");
        log_message(3, "file", 2, "function%s", "rate 50%%");
        const QByteArray streamed = error.text();
        const QList<SyslogLine> lines = SyslogCapture::lines();
        QCOMPARE(lines.size(), 2);
        QVERIFY2(lines.at(0).text.endsWith(", 1, function, user said 100% %n %s sure "), lines.at(0).text.constData());
        QVERIFY2(lines.at(1).text.endsWith(", 2, function%s, rate 50% "), lines.at(1).text.constData());
        QVERIFY(streamed.contains("user said 100% %n %s sure \n"));
    }

    void overlongBodyIsCut()
    {
        const QByteArray body(20000, 'a');
        log_message(6, "file", 1, "function", "%s", body.constData());
        const QList<SyslogLine> lines = SyslogCapture::lines();
        QCOMPARE(lines.size(), 1);
        QVERIFY(lines.first().text.contains(QByteArray(8189, 'a')));
        QVERIFY(!lines.first().text.contains(QByteArray(8190, 'a')));
    }

    void processName()
    {
        char name[64] = {};
        QCOMPARE(get_process_name(name), 1);
        QCOMPARE(QByteArray(name), QByteArray("test_logmessage"));
    }
};

QTEST_GUILESS_MAIN(LogMessageTest)
#include "test_logmessage.moc"
