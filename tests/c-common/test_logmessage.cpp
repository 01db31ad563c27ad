#include "common.h"
#include "syslogcapture.h"

#include <QTemporaryFile>
#include <QTest>

#include <unistd.h>

namespace
{
// Collects what one stream receives while it lives.
class StreamCapture
{
public:
    explicit StreamCapture(FILE *stream)
        : m_stream(stream)
        , m_saved(dup(fileno(stream)))
    {
        m_file.open();
        dup2(m_file.handle(), fileno(stream));
    }
    ~StreamCapture() { text(); }
    QByteArray text()
    {
        if (m_saved >= 0) {
            fflush(m_stream);
            dup2(m_saved, fileno(m_stream));
            close(m_saved);
            m_saved = -1;
        }
        m_file.seek(0);
        return m_file.readAll();
    }

private:
    FILE *m_stream;
    int m_saved;
    QTemporaryFile m_file;
};

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
        StreamCapture error(stderr);
        log_message(3, "src/c-common/common", 273, "is_connect", "%d%% %s", 100, "%n sure");
        const QByteArray streamed = error.text();

        const QList<SyslogLine> lines = SyslogCapture::lines();
        QCOMPARE(lines.size(), 1);
        QCOMPARE(lines.first().priority, 3);
        const QByteArray line = lines.first().text;
        QVERIFY2(QRegExp(QStringLiteral("\\d{4}-\\d\\d-\\d\\d \\d\\d:\\d\\d:\\d\\d"))
                     .exactMatch(QString::fromLatin1(line.left(19))),
            line);
        QCOMPARE(line.mid(19), " process: test_logmessage(" + QByteArray::number(getpid()) + "), " + tail);
        QCOMPARE(streamed, line + '\n');
    }

    void levels_data()
    {
        QTest::addColumn<int>("level");
        QTest::addColumn<QByteArray>("logLevel");
        QTest::addColumn<bool>("toSyslog");
        QTest::addColumn<bool>("toStderr");
        QTest::addColumn<bool>("toStdout");
        QTest::newRow("warning") << 4 << QByteArray() << true << true << false;
        QTest::newRow("notice") << 5 << QByteArray() << true << false << false;
        QTest::newRow("debug") << 7 << QByteArray() << true << false << false;
        QTest::newRow("trace, variable unset") << 9 << QByteArray() << false << false << false;
        QTest::newRow("trace, variable empty") << 8 << QByteArray("") << false << false << false;
        QTest::newRow("trace, variable 0") << 9 << QByteArray("0") << true << false << true;
    }

    void levels()
    {
        QFETCH(int, level);
        QFETCH(QByteArray, logLevel);
        QFETCH(bool, toSyslog);
        QFETCH(bool, toStderr);
        QFETCH(bool, toStdout);
        setEnv("KEST_IAM_LOGLEVEL", logLevel);
        StreamCapture error(stderr);
        StreamCapture output(stdout);
        log_message(level, "file", 1, "function", "level test");
        QCOMPARE(error.text().contains("level test"), toStderr);
        QCOMPARE(output.text().contains("level test"), toStdout);
        qunsetenv("KEST_IAM_LOGLEVEL");
        QCOMPARE(SyslogCapture::count("level test"), toSyslog ? 1 : 0);
        if (toSyslog)
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
