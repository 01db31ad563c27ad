#include "privatebus.h"
#include "serviceprocess.h"
#include "testaccounts.h"
#include "testroot.h"

#include <QDBusConnectionInterface>
#include <QDBusReply>
#include <QDir>
#include <QFile>
#include <QFileInfo>
#include <QTest>

#include <csignal>

namespace
{
const QString pidFile = QStringLiteral("/run/dbus-kest.pid");
const int pidFileWaitMs = 15000;

QStringList guardFiles(const QString &directory)
{
    return QDir(directory).entryList({ QStringLiteral("qipc_*") }, QDir::Files);
}
} // namespace

// The process entry of dbus-kest: exit codes, the single-instance guard, the pid file, idle mode, signals.
class DBusKestProcessTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        QVERIFY2(m_bus.isRunning(), qPrintable(m_bus.errorText()));
        m_connection = QDBusConnection::connectToBus(m_bus.address(), QStringLiteral("process-test"));
        QVERIFY(m_connection.isConnected());
        QVERIFY(m_root.isValid());
        QVERIFY(m_root.writeSettings("[main]\nenable=true\n"));
    }

    void cleanupTestCase() { QDBusConnection::disconnectFromBus(QStringLiteral("process-test")); }

    void refusedStart_data()
    {
        QTest::addColumn<QString>("reason");
        QTest::addColumn<int>("expectedStatus");
        QTest::addColumn<bool>("pidFileKept");

        // Not root: refused before the guard and the pid file are looked at.
        QTest::newRow("not root") << QStringLiteral("nobody") << 2 << true;
        // -4: the guard's key file cannot be made where TMPDIR points.
        QTest::newRow("guard cannot be created") << QStringLiteral("guard directory is a file") << 252 << true;
        // -2: the stale pid file is already gone when the name turns out to be taken.
        QTest::newRow("name owned by another") << QStringLiteral("name taken") << 254 << false;
    }

    void refusedStart()
    {
        QFETCH(QString, reason);
        QFETCH(int, expectedStatus);
        QFETCH(bool, pidFileKept);

        QVERIFY(m_root.writeFile(pidFile, "4242\n"));
        ServiceProcess service;
        if (reason == QLatin1String("nobody"))
            service.setWrapper({ QStringLiteral("setpriv"), QStringLiteral("--reuid=65534"),
                QStringLiteral("--regid=65534"), QStringLiteral("--clear-groups") });
        if (reason == QLatin1String("guard directory is a file")) {
            const QString notADirectory = service.guardDirectory() + QStringLiteral("/file");
            QVERIFY(QFile(notADirectory).open(QIODevice::WriteOnly));
            service.setGuardDirectory(notADirectory);
        }
        if (reason == QLatin1String("name taken"))
            QVERIFY(m_connection.registerService(ServiceProcess::serviceName()));

        QVERIFY2(service.start(), qPrintable(service.errorText()));
        QVERIFY(service.waitForExit());
        if (reason == QLatin1String("name taken"))
            QVERIFY(m_connection.unregisterService(ServiceProcess::serviceName()));

        QCOMPARE(service.exitStatus(), QProcess::NormalExit);
        QCOMPARE(service.exitCode(), expectedStatus);
        QCOMPARE(QFile::exists(m_root.filePath(pidFile)), pidFileKept);
        if (pidFileKept)
            QCOMPARE(m_root.readFile(pidFile), QByteArray("4242\n"));
        // Whatever the exit, no segment is left behind for the next start.
        const QFileInfo guard(service.guardDirectory());
        QCOMPARE(guardFiles(guard.isDir() ? guard.filePath() : guard.absolutePath()), QStringList());
    }

    // One run through the life of an instance, so that the five-second pid file wait happens once.
    void lifecycle()
    {
        QVERIFY(m_root.writeFile(pidFile, "99999\n"));

        ServiceProcess idle;
        idle.setArguments({ QStringLiteral("idle") });
        QVERIFY(idle.start());

        ServiceProcess first(idle.guardDirectory());
        QVERIFY(first.start());
        QVERIFY2(first.waitUntilServing(m_connection), "the first instance does not serve; is the guard taken?");
        QVERIFY2(!QFile::exists(m_root.filePath(pidFile)), "a stale pid file survives the start");

        ServiceProcess second(idle.guardDirectory());
        QVERIFY(second.start());
        QVERIFY(second.waitForExit());
        QCOMPARE(second.exitStatus(), QProcess::NormalExit);
        QCOMPARE(second.exitCode(), 255);
        QCOMPARE(m_connection.interface()->servicePid(ServiceProcess::serviceName()).value(), uint(first.pid()));
        QVERIFY(callService(m_connection, QStringLiteral("GetUserIdList")).type() == QDBusMessage::ReplyMessage);

        QTRY_VERIFY_WITH_TIMEOUT(QFile::exists(m_root.filePath(pidFile)), pidFileWaitMs);
        QCOMPARE(m_root.readFile(pidFile), QByteArray::number(first.pid()));
        QCOMPARE(QFile::permissions(m_root.filePath(pidFile)),
            QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ReadUser | QFileDevice::WriteUser
                | QFileDevice::ReadGroup | QFileDevice::ReadOther);

        QVERIFY(first.signal(SIGTERM));
        QVERIFY(first.waitForExit());
        QCOMPARE(first.exitStatus(), QProcess::NormalExit);
        QCOMPARE(first.exitCode(), 15);
        QCOMPARE(m_root.readFile(pidFile), QByteArray::number(first.pid()));
        QCOMPARE(guardFiles(idle.guardDirectory()), QStringList());

        // The idle process, older than the pid file timer, never took the name, the guard or the pid file.
        QVERIFY(idle.isRunning());
        QVERIFY(!m_connection.interface()->isServiceRegistered(ServiceProcess::serviceName()).value());

        ServiceProcess third(idle.guardDirectory());
        QVERIFY(third.start());
        QVERIFY2(third.waitUntilServing(m_connection), "the guard of the terminated instance is still held");
        QVERIFY(!QFile::exists(m_root.filePath(pidFile)));
        QVERIFY(third.signal(SIGINT));
        QVERIFY(third.waitForExit());
        QCOMPARE(third.exitStatus(), QProcess::NormalExit);
        QCOMPARE(third.exitCode(), 2);

        // Idle mode installs no handler: the signal ends it the default way.
        QVERIFY(idle.signal(SIGTERM));
        QVERIFY(idle.waitForExit());
        QCOMPARE(idle.exitStatus(), QProcess::CrashExit);
    }

private:
    PrivateBus m_bus;
    TestRoot m_root;
    QDBusConnection m_connection { QString() };
};

QTEST_GUILESS_MAIN(DBusKestProcessTest)
#include "test_dbuskestprocess.moc"
