#include "privatebus.h"
#include "serviceprocess.h"
#include "testaccounts.h"
#include "testroot.h"

#include <QProcess>
#include <QTemporaryDir>
#include <QTest>

#include <grp.h>

enum class Caller { Root, Nobody, NobodyInSudo };
Q_DECLARE_METATYPE(Caller)

namespace
{
// setpriv in front of the client drops root; the sudo group comes as a supplementary group.
QStringList callerWrapper(Caller caller)
{
    if (caller == Caller::Root)
        return QStringList();
    QStringList wrapper { QStringLiteral("setpriv"), QStringLiteral("--reuid=65534"), QStringLiteral("--regid=65534") };
    if (caller == Caller::Nobody) {
        wrapper.append(QStringLiteral("--clear-groups"));
    } else {
        const group *sudo = getgrnam("sudo");
        wrapper.append(QStringLiteral("--groups=") + QString::number(sudo ? sudo->gr_gid : 0));
    }
    return wrapper;
}
} // namespace

// The bus policy file on a bus that, like the machine's system bus, denies what no policy allows.
class DBusKestPolicyTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        QVERIFY2(m_bus.isRunning(), qPrintable(m_bus.errorText()));
        QVERIFY(m_bus.openToOtherUsers());
        m_connection = QDBusConnection::connectToBus(m_bus.address(), QStringLiteral("policy-test"));
        QVERIFY(m_root.isValid());
        QVERIFY(m_root.writeSettings("[main]\nenable=true\n"));
        QVERIFY(writeCacheRecord(testAccount(10001, QStringLiteral("@alice"))));
        // No cache-kest on the search path: a permitted password change returns at once.
        m_service.setSearchPath(m_emptyDirectory.path());
        QVERIFY(m_service.start());
        QVERIFY2(m_service.waitUntilServing(m_connection), "root may not own com.nimbal.kest.iam");
    }

    void cleanupTestCase()
    {
        QVERIFY(m_service.stop());
        QDBusConnection::disconnectFromBus(QStringLiteral("policy-test"));
    }

    void access_data()
    {
        QTest::addColumn<Caller>("caller");
        QTest::addColumn<QString>("path");
        QTest::addColumn<QString>("method");
        QTest::addColumn<QStringList>("arguments");
        QTest::addColumn<bool>("allowed");

        const QString main = servicePath();
        const QString user = userObjectPath(10001);
        const QString get = QStringLiteral("org.freedesktop.DBus.Properties.Get");
        const QString set = QStringLiteral("org.freedesktop.DBus.Properties.Set");
        const QString iam = QStringLiteral("com.nimbal.kest.iam");
        const QStringList enable { iam, QStringLiteral("Enable") };
        const QStringList enableOn { iam, QStringLiteral("Enable"), QStringLiteral("<true>") };
        const QStringList noUid { QStringLiteral("20000") };
        auto method = [&iam](const char *member) { return iam + QLatin1Char('.') + QLatin1String(member); };

        QTest::newRow("anyone lists uids")
            << Caller::Nobody << main << method("GetUserIdList") << QStringList() << true;
        QTest::newRow("anyone reads groups")
            << Caller::Nobody << main << method("GetUserGroups") << QStringList { QStringLiteral("@alice") } << true;
        QTest::newRow("anyone reads the policy")
            << Caller::Nobody << main << method("QueryPasswordConfig") << QStringList() << true;
        QTest::newRow("anyone changes a password")
            << Caller::Nobody << main << method("ModifyUserPassword")
            << QStringList { QStringLiteral("@alice"), QStringLiteral("old"), QStringLiteral("new") } << true;
        QTest::newRow("anyone reads Enable") << Caller::Nobody << main << get << enable << true;
        QTest::newRow("anyone reads a user object")
            << Caller::Nobody << user << get
            << QStringList { QStringLiteral("com.nimbal.kest.iam.user"), QStringLiteral("UserName") } << true;
        QTest::newRow("anyone may not remove all")
            << Caller::Nobody << main << method("RemoveAllCacheFiles") << QStringList() << false;
        QTest::newRow("anyone may not remove one")
            << Caller::Nobody << main << method("RemoveCacheFile") << noUid << false;
        QTest::newRow("anyone may not remove others") << Caller::Nobody << main << method("RemoveCacheFilesNotInList")
                                                      << QStringList { QStringLiteral("[10001]") } << false;
        QTest::newRow("anyone may not disable")
            << Caller::Nobody << main << method("DisableTerminal") << noUid << false;
        QTest::newRow("anyone may not write Enable") << Caller::Nobody << main << set << enableOn << false;
        QTest::newRow("anyone may not announce sessions")
            << Caller::Nobody << main << method("SessionNew")
            << QStringList { QStringLiteral("c1"), QStringLiteral("/org/freedesktop/login1/session/c1") } << false;
        QTest::newRow("sudo removes") << Caller::NobodyInSudo << main << method("RemoveCacheFile") << noUid << true;
        QTest::newRow("sudo disables") << Caller::NobodyInSudo << main << method("DisableTerminal") << noUid << true;
        QTest::newRow("sudo writes Enable") << Caller::NobodyInSudo << main << set << enableOn << true;
        QTest::newRow("root removes") << Caller::Root << main << method("RemoveCacheFile") << noUid << true;
        QTest::newRow("root disables") << Caller::Root << main << method("DisableTerminal") << noUid << true;
        QTest::newRow("root writes Enable") << Caller::Root << main << set << enableOn << true;
    }

    void access()
    {
        QFETCH(Caller, caller);
        QFETCH(QString, path);
        QFETCH(QString, method);
        QFETCH(QStringList, arguments);
        QFETCH(bool, allowed);
        if (caller == Caller::NobodyInSudo && !getgrnam("sudo"))
            QSKIP("this machine has no group sudo");

        // gdbus reads the argument types from the service's introspection, which everyone may ask for.
        const QStringList client = callerWrapper(caller)
            + QStringList { QStringLiteral("gdbus"), QStringLiteral("call"), QStringLiteral("--system"),
                  QStringLiteral("--dest"), ServiceProcess::serviceName(), QStringLiteral("--object-path"), path,
                  QStringLiteral("--method"), method }
            + arguments;
        QProcess call;
        call.start(client.first(), client.mid(1));
        QVERIFY2(call.waitForFinished(30000), qPrintable(call.errorString()));
        const QByteArray errors = call.readAllStandardError();

        QCOMPARE(call.exitCode() == 0, allowed);
        QCOMPARE(errors.contains("org.freedesktop.DBus.Error.AccessDenied"), !allowed);
        // None of the permitted calls above changes anything, and refused ones never arrive.
        QCOMPARE(cachedUids(), QList<uint> { 10001 });
        QCOMPARE(m_root.readFile(QStringLiteral("/etc/kest-iam.conf")), QByteArray("[main]\nenable=true\n"));
    }

private:
    PrivateBus m_bus { PrivateBus::Policy::System, { QStringLiteral(KEST_POLICY_FILE) } };
    TestRoot m_root;
    QDBusConnection m_connection { QString() };
    QTemporaryDir m_emptyDirectory;
    ServiceProcess m_service;
};

QTEST_GUILESS_MAIN(DBusKestPolicyTest)
#include "test_dbuskestpolicy.moc"
