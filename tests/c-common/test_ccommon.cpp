#include "cache-common.h"
#include "cachedaemonfixture.h"
#include "common.h"
#include "loopbackpeer.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QCoreApplication>
#include <QFile>
#include <QProcess>
#include <QTemporaryFile>
#include <QTest>

#include <cstdio>
#include <dlfcn.h>
#include <unistd.h>

namespace
{
// This binary started again under another name by processNames(): prints what the checks make of it.
void probeIfAsked()
{
    if (!qEnvironmentVariableIsSet("KEST_CALLER_PROBE"))
        return;
    printf("%d %d %d\n", is_trusted_caller(), is_printer_caller(), is_accounts_daemon());
    fflush(stdout);
    _exit(0);
}
Q_CONSTRUCTOR_FUNCTION(probeIfAsked)
} // namespace

// The library as the modules use it: what a caller of a given name is shown, where the daemon is found, how it
// is asked, how it logs and how it loads the machine's name-service libraries.
class CCommonTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void init() { SyslogCapture::clear(); }

    void processNames_data()
    {
        QTest::addColumn<QString>("argument0");
        QTest::addColumn<QByteArray>("expected"); // trusted, printer, accounts daemon
        QTest::newRow("sudo") << QStringLiteral("/usr/bin/sudo") << QByteArray("1 0 0");
        QTest::newRow("lpadmin") << QStringLiteral("/usr/sbin/lpadmin") << QByteArray("0 1 0");
        QTest::newRow("accounts-daemon") << QStringLiteral("accounts-daemon") << QByteArray("1 0 1");
        QTest::newRow("cache-kest") << QStringLiteral("/usr/sbin/cache-kest") << QByteArray("1 0 0");
        QTest::newRow("other") << QStringLiteral("/usr/bin/Sudo") << QByteArray("0 0 0");
        QTest::newRow("directory of a trusted name") << QStringLiteral("/sudo/x") << QByteArray("0 0 0");
        QTest::newRow("name unreadable") << QString() << QByteArray("1 1 0");
    }

    void processNames()
    {
        QFETCH(QString, argument0);
        QProcess probe;
        probe.start(QStringLiteral("bash"),
            { QStringLiteral("-c"), QStringLiteral("KEST_CALLER_PROBE=1 exec -a \"$0\" \"$1\""), argument0,
                QCoreApplication::applicationFilePath() });
        QVERIFY(probe.waitForFinished());
        QTEST(probe.readAllStandardOutput().trimmed(), "expected");
    }

    // What each reader of the pid file makes of it: "exists pid running port daemonPort", "-" where one fails.
    void pidFile_data()
    {
        QTest::addColumn<QString>("process"); // a sleeper's name; its pid stands for PID
        QTest::addColumn<QByteArray>("content");
        QTest::addColumn<QByteArray>("expected");
        QTest::newRow("cache-kest, port wraps")
            << QStringLiteral("cache-kest") << QByteArray("PID\n70000\n") << QByteArray("1 PID 1 4464 4464");
        QTest::newRow("pid now used by another program")
            << QStringLiteral("cache-kest-old") << QByteArray("PID\n10080\n") << QByteArray("1 PID 0 10080 -");
        QTest::newRow("no such process, CRLF, blank last line")
            << QString() << QByteArray("999999999\r\n10080\r\n\n") << QByteArray("1 999999999 0 10080 -");
        QTest::newRow("port not digits") << QString() << QByteArray("999999999\n80a\n")
                                         << QByteArray("1 999999999 0 - -");
        QTest::newRow("blank first line") << QString() << QByteArray("\n10080\n") << QByteArray("1 - 0 10080 -");
        QTest::newRow("empty") << QString() << QByteArray("") << QByteArray("0 - 0 - -");
    }

    void pidFile()
    {
        QFETCH(QString, process);
        QFETCH(QByteArray, content);
        QFETCH(QByteArray, expected);
        TestRoot root;
        QProcess sleeper;
        if (!process.isEmpty()) {
            // Through a link: the sleeper's first argument is a longer path that ends in that name.
            QVERIFY(QFile::link(QStringLiteral("/bin/sleep"), root.filePath(QLatin1Char('/') + process)));
            sleeper.start(root.filePath(QLatin1Char('/') + process), { QStringLiteral("30") });
            QVERIFY(sleeper.waitForStarted());
        }
        const QByteArray pid = QByteArray::number(sleeper.processId());
        QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"), content.replace("PID", pid)));
        char pidText[64];
        unsigned short port = 0, daemonPort = 0;
        const bool pidRead = read_pid_file(pidText), portRead = read_port(&port);
        const QByteArrayList seen { QByteArray::number(pid_file_exists()), pidRead ? QByteArray(pidText) : "-",
            QByteArray::number(is_cache_daemon_running()), portRead ? QByteArray::number(port) : "-",
            cache_daemon_port(&daemonPort, nullptr) ? QByteArray::number(daemonPort) : "-" };
        QCOMPARE(seen.join(' '), expected.replace("PID", pid));
        sleeper.kill();
        sleeper.waitForFinished();
    }

    // Every failure is one error in the log; the reply comes without its frame.
    void query_data()
    {
        QTest::addColumn<bool>("pidFile");
        QTest::addColumn<QByteArray>("answer"); // null: nobody listens
        QTest::newRow("reply is unframed") << true << QByteArray("\0\0\0\5hello", 9);
        QTest::newRow("no pid file") << false << QByteArray();
        QTest::newRow("nothing listening") << true << QByteArray();
        QTest::newRow("closed without reply") << true << QByteArray("");
    }

    void query()
    {
        QFETCH(bool, pidFile);
        QFETCH(QByteArray, answer);
        TestRoot root;
        LoopbackPeer peer(answer.isNull() ? QList<QByteArray>() : QList<QByteArray> { answer });
        if (answer.isNull())
            peer.finish();
        if (pidFile)
            QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"), "1\n" + QByteArray::number(peer.port())));

        const QByteArray request("\0\0\0\2{}", 6);
        QByteArray reply(64, 0x7f);
        const bool success = answer.size() > 4;
        QCOMPARE(socket_query(request.constData(), size_t(request.size()),
                     reinterpret_cast<unsigned char *>(reply.data()), size_t(reply.size())),
            success ? 1 : 0);
        if (success)
            QCOMPARE(reply, "hello" + QByteArray(reply.size() - 5, '\0'));
        QCOMPARE(SyslogCapture::lines().size(), success ? 0 : 1);
        QCOMPARE(SyslogCapture::lines().value(0).priority, success ? 0 : 3);
    }

    // The modules' reader takes a whole frame, however long, within its limit.
    void queryFrame_data()
    {
        QTest::addColumn<QByteArray>("answer");
        QTest::addColumn<QByteArray>("body"); // null: no reply, one error logged
        const auto frame = &CacheDaemonFixture::frame;
        const QByteArray large(100000, 'a');
        QTest::newRow("in one receive") << frame("hello") << QByteArray("hello");
        QTest::newRow("beyond the first receive") << frame(large) << large;
        QTest::newRow("cut short") << QByteArray("\0\0\0\12abc", 7) << QByteArray();
        QTest::newRow("above the limit") << frame(large + 'b') << QByteArray();
    }

    void queryFrame()
    {
        QFETCH(QByteArray, answer);
        QFETCH(QByteArray, body);
        LoopbackPeer peer({ answer });
        char *reply = nullptr;
        const int answered = socket_query_frame(peer.port(), "\0\0\0\2{}", 6, &reply, 100000);
        QCOMPARE(answered ? QByteArray(reply) : QByteArray(), body);
        free(reply);
        QCOMPARE(SyslogCapture::lines().size(), body.isNull() ? 1 : 0);
    }

    // An empty suffix falls back to the versioned name as a missing one does; a given one is taken as it is.
    void nssLibrary()
    {
        nss_function_entry table[NSS_FUNCTION_COUNT] = {};
        for (const char *suffix : { "", ".2" }) {
            void *handle = load_nss_library("files", suffix, table);
            QVERIFY2(handle, suffix);
            dlclose(handle);
        }
        QVERIFY(SyslogCapture::lines().isEmpty());
        QVERIFY(!load_nss_library("files", ".7", table));
        QVERIFY(!load_nss_library("kestnone", nullptr, table));
        QCOMPARE(SyslogCapture::lines().size(), 2);
    }

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
        for (const auto &[name, value] : { std::pair { "USER", user }, std::pair { "KEST_IAM_LOGLEVEL", logLevel } })
            value.isNull() ? qunsetenv(name) : qputenv(name, value);
        // A body that printf would take for conversions once it were used as a format.
        QTemporaryFile files[2];
        int saved[2];
        for (int i = 0; i < 2; ++i) {
            files[i].open();
            saved[i] = dup(2 - i);
            dup2(files[i].handle(), 2 - i);
        }
        log_message(level, "src/c-common/common", 273, "is_connect", "%d%% %s", 100, "%n sure");
        fflush(nullptr);
        QByteArrayList streams;
        for (int i = 0; i < 2; ++i) {
            dup2(saved[i], 2 - i);
            close(saved[i]);
            files[i].seek(0);
            streams << files[i].readAll();
        }
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
            " process: test_ccommon(" + QByteArray::number(getpid())
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

QTEST_GUILESS_MAIN(CCommonTest)
#include "test_ccommon.moc"
