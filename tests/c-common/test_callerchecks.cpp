#include "common.h"
#include "testroot.h"

#include <QDir>
#include <QFile>
#include <QProcess>
#include <QTemporaryDir>
#include <QTest>

class CallerChecksTest : public QObject
{
    Q_OBJECT

private:
    static QString probePath()
    {
        return QString::fromLocal8Bit(qgetenv("KEST_TEST_BINARY_DIR")) + QStringLiteral("/tests/c-common/callerprobe");
    }

    // Starts `target` through a link named `name`, so its first argument ends in that name.
    static bool startAs(QProcess &process, const QTemporaryDir &dir, const QString &name, const QString &target,
                        const QStringList &arguments = QStringList())
    {
        const QString link = dir.filePath(name);
        QFile::remove(link);
        if (!QFile::link(target, link))
            return false;
        process.start(link, arguments);
        return process.waitForStarted();
    }

private Q_SLOTS:
    void processNames_data()
    {
        QTest::addColumn<QString>("name");
        QTest::addColumn<bool>("blank");
        QTest::addColumn<QByteArray>("expected"); // trusted, printer, accounts daemon

        QTest::newRow("sudo") << QStringLiteral("sudo") << false << QByteArray("1 0 0");
        QTest::newRow("lpadmin") << QStringLiteral("lpadmin") << false << QByteArray("0 1 0");
        QTest::newRow("ose-printer") << QStringLiteral("ose-printer") << false << QByteArray("0 1 0");
        QTest::newRow("accounts-daemon") << QStringLiteral("accounts-daemon") << false << QByteArray("1 0 1");
        QTest::newRow("cache-kest") << QStringLiteral("cache-kest") << false << QByteArray("1 0 0");
        QTest::newRow("systemd-logind") << QStringLiteral("systemd-logind") << false << QByteArray("1 0 0");
        QTest::newRow("other") << QStringLiteral("gnome-shell") << false << QByteArray("0 0 0");
        QTest::newRow("capitalised") << QStringLiteral("Sudo") << false << QByteArray("0 0 0");
        QTest::newRow("unreadable") << QStringLiteral("blank") << true << QByteArray("1 1 0");
    }

    void processNames()
    {
        QFETCH(QString, name);
        QFETCH(bool, blank);
        QFETCH(QByteArray, expected);

        QTemporaryDir dir;
        QVERIFY(dir.isValid());
        QProcess probe;
        if (blank) {
            QProcessEnvironment environment = QProcessEnvironment::systemEnvironment();
            environment.insert(QStringLiteral("KEST_PROBE_BLANK_NAME"), QStringLiteral("1"));
            probe.setProcessEnvironment(environment);
        }
        QVERIFY(startAs(probe, dir, name, probePath()));
        QVERIFY(probe.waitForFinished());
        QCOMPARE(probe.exitCode(), 0);
        QCOMPARE(probe.readAllStandardOutput().trimmed(), expected);
    }

    void specialGroups_data()
    {
        QTest::addColumn<QByteArray>("group");
        QTest::addColumn<int>("expected");
        for (const char *special : { "users", "kest", "sudo", "lp", "lpadmin", "scanner", "dialout" })
            QTest::newRow(special) << QByteArray(special) << 0;
        QTest::newRow("wheel") << QByteArray("wheel") << 1;
        QTest::newRow("capital Sudo") << QByteArray("Sudo") << 1;
        QTest::newRow("prefix lpad") << QByteArray("lpad") << 1;
        QTest::newRow("empty") << QByteArray("") << 1;
    }

    void specialGroups()
    {
        QFETCH(QByteArray, group);
        QFETCH(int, expected);
        QCOMPARE(is_special_group(group.constData()), expected);
    }

    void pidFile_data()
    {
        QTest::addColumn<QByteArray>("content");
        QTest::addColumn<bool>("exists");
        QTest::addColumn<QByteArray>("pid");

        QTest::newRow("missing") << QByteArray() << false << QByteArray();
        QTest::newRow("empty") << QByteArray("") << false << QByteArray();
        QTest::newRow("pid and port") << QByteArray("4711\n10080\n") << true << QByteArray("4711");
        QTest::newRow("carriage return") << QByteArray("4711\r\n") << true << QByteArray("4711");
        QTest::newRow("blank first line") << QByteArray("\n10080\n") << true << QByteArray();
    }

    void pidFile()
    {
        QFETCH(QByteArray, content);
        QFETCH(bool, exists);
        QFETCH(QByteArray, pid);

        TestRoot root;
        QVERIFY(root.isValid());
        if (!content.isNull())
            QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"), content));

        QCOMPARE(pid_file_exists(), exists ? 1 : 0);
        char buffer[64];
        QCOMPARE(read_pid_file(buffer), pid.isEmpty() ? 0 : 1);
        if (!pid.isEmpty())
            QCOMPARE(QByteArray(buffer), pid);
    }

    void daemonRunning_data()
    {
        QTest::addColumn<QString>("processName"); // empty: write the given pid text instead
        QTest::addColumn<QByteArray>("pidText");
        QTest::addColumn<int>("expected");

        QTest::newRow("cache-kest") << QStringLiteral("cache-kest") << QByteArray() << 1;
        QTest::newRow("another program") << QStringLiteral("other-daemon") << QByteArray() << 0;
        QTest::newRow("longer name ending in cache-kest")
            << QStringLiteral("my-cache-kest") << QByteArray() << 1;
        QTest::newRow("empty pid file") << QString() << QByteArray("") << 0;
        QTest::newRow("no such process") << QString() << QByteArray("999999999\n10080\n") << 0;
        QTest::newRow("no pid file") << QString() << QByteArray() << 0;
    }

    void daemonRunning()
    {
        QFETCH(QString, processName);
        QFETCH(QByteArray, pidText);
        QFETCH(int, expected);

        TestRoot root;
        QVERIFY(root.isValid());
        QTemporaryDir dir;
        QProcess sleeper;
        if (!processName.isEmpty()) {
            QVERIFY(startAs(sleeper, dir, processName, QStringLiteral("/bin/sleep"), { QStringLiteral("30") }));
            pidText = QByteArray::number(sleeper.processId()) + "\n10080\n";
        }
        if (!pidText.isNull())
            QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"), pidText));

        QCOMPARE(is_cache_daemon_running(), expected);
        if (sleeper.state() != QProcess::NotRunning) {
            sleeper.kill();
            sleeper.waitForFinished();
        }
    }
};

QTEST_GUILESS_MAIN(CallerChecksTest)
#include "test_callerchecks.moc"
