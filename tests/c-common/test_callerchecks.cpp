#include "common.h"

#include <QCoreApplication>
#include <QProcess>
#include <QTest>

#include <cstdio>
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

class CallerChecksTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
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
        QProcessEnvironment environment = QProcessEnvironment::systemEnvironment();
        environment.insert(QStringLiteral("KEST_CALLER_PROBE"), QStringLiteral("1"));
        probe.setProcessEnvironment(environment);
        probe.start(QStringLiteral("bash"),
            { QStringLiteral("-c"), QStringLiteral("exec -a \"$0\" \"$1\""), argument0,
                QCoreApplication::applicationFilePath() });
        QVERIFY(probe.waitForFinished());
        QTEST(probe.readAllStandardOutput().trimmed(), "expected");
    }

    void specialGroups()
    {
        for (const char *group : { "users", "kest", "sudo", "lp", "lpadmin", "scanner", "dialout" })
            QVERIFY2(is_special_group(group) == 0, group);
        for (const char *group : { "wheel", "Sudo", "lpad", "" })
            QVERIFY2(is_special_group(group) == 1, group);
    }
};

QTEST_GUILESS_MAIN(CallerChecksTest)
#include "test_callerchecks.moc"
