#include "common.h"
#include "testroot.h"

#include <QFile>
#include <QProcess>
#include <QTemporaryDir>
#include <QTest>

namespace
{
// Starts target through a link named name, so that its first argument ends in that name.
bool startAs(QProcess &process, const QTemporaryDir &dir, const QString &name, const QString &target,
    const QStringList &arguments = {})
{
    const QString link = dir.filePath(name);
    if (!QFile::link(target, link))
        return false;
    process.start(link, arguments);
    return process.waitForStarted();
}
} // namespace

class CallerChecksTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void processNames_data()
    {
        QTest::addColumn<QString>("name");
        QTest::addColumn<QByteArray>("expected"); // trusted, printer, accounts daemon
        QTest::newRow("sudo") << QStringLiteral("sudo") << QByteArray("1 0 0");
        QTest::newRow("lpadmin") << QStringLiteral("lpadmin") << QByteArray("0 1 0");
        QTest::newRow("accounts-daemon") << QStringLiteral("accounts-daemon") << QByteArray("1 0 1");
        QTest::newRow("cache-kest") << QStringLiteral("cache-kest") << QByteArray("1 0 0");
        QTest::newRow("other") << QStringLiteral("Sudo") << QByteArray("0 0 0");
        QTest::newRow("name unreadable") << QString() << QByteArray("1 1 0");
    }

    void processNames()
    {
        QFETCH(QString, name);
        QFETCH(QByteArray, expected);
        QTemporaryDir dir;
        QProcess probe;
        if (name.isEmpty()) {
            QProcessEnvironment environment = QProcessEnvironment::systemEnvironment();
            environment.insert(QStringLiteral("KEST_PROBE_BLANK_NAME"), QStringLiteral("1"));
            probe.setProcessEnvironment(environment);
        }
        const QString probePath
            = qEnvironmentVariable("KEST_TEST_BINARY_DIR") + QStringLiteral("/tests/c-common/callerprobe");
        QVERIFY(startAs(probe, dir, name.isEmpty() ? QStringLiteral("probe") : name, probePath));
        QVERIFY(probe.waitForFinished());
        QCOMPARE(probe.readAllStandardOutput().trimmed(), expected);
    }

    void specialGroups()
    {
        for (const char *group : { "users", "kest", "sudo", "lp", "lpadmin", "scanner", "dialout" })
            QCOMPARE(is_special_group(group), 0);
        for (const char *group : { "wheel", "Sudo", "lpad", "" })
            QCOMPARE(is_special_group(group), 1);
    }

    void daemonRunning_data()
    {
        QTest::addColumn<QString>("processName"); // empty: the pid file holds pidText
        QTest::addColumn<QByteArray>("pidText");
        QTest::addColumn<int>("expected");
        QTest::newRow("cache-kest") << QStringLiteral("cache-kest") << QByteArray() << 1;
        QTest::newRow("longer name ending in cache-kest") << QStringLiteral("my-cache-kest") << QByteArray() << 1;
        QTest::newRow("pid now used by another program") << QStringLiteral("other") << QByteArray() << 0;
        QTest::newRow("empty pid file") << QString() << QByteArray("") << 0;
        QTest::newRow("blank first line") << QString() << QByteArray("\n10080\n") << 0;
        QTest::newRow("no such process") << QString() << QByteArray("999999999\r\n10080\n") << 0;
        QTest::newRow("no pid file") << QString() << QByteArray() << 0;
    }

    void daemonRunning()
    {
        QFETCH(QString, processName);
        QFETCH(QByteArray, pidText);
        QFETCH(int, expected);
        TestRoot root;
        QTemporaryDir dir;
        QProcess sleeper;
        if (!processName.isEmpty()) {
            QVERIFY(startAs(sleeper, dir, processName, QStringLiteral("/bin/sleep"), { QStringLiteral("30") }));
            pidText = QByteArray::number(sleeper.processId()) + "\r\n10080\n";
        }
        if (!pidText.isNull())
            QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"), pidText));

        QCOMPARE(pid_file_exists(), pidText.isEmpty() ? 0 : 1);
        char pid[64];
        const QByteArray firstLine = pidText.split('\n').first().trimmed();
        QCOMPARE(read_pid_file(pid), firstLine.isEmpty() ? 0 : 1);
        if (!firstLine.isEmpty())
            QCOMPARE(QByteArray(pid), firstLine);
        QCOMPARE(is_cache_daemon_running(), expected);
        sleeper.kill();
        sleeper.waitForFinished();
    }
};

QTEST_GUILESS_MAIN(CallerChecksTest)
#include "test_callerchecks.moc"
