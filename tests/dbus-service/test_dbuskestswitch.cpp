#include "cachestore.h"
#include "dbuskestservice.h"
#include "fakepeers.h"
#include "messagehandler.h"
#include "privatebus.h"
#include "syslogcapture.h"
#include "testaccounts.h"
#include "testroot.h"

#include <QDBusConnectionInterface>
#include <QDir>
#include <QTest>

#include <syslog.h>

namespace
{
const QString serviceConnection = QStringLiteral("switch-test-service");
const QString clientConnection = QStringLiteral("switch-test-client");

// Log lines of the priority whose message (after the "cpu time: N, " prefix) is exactly the text.
int logged(int priority, const QString &message)
{
    int count = 0;
    const QList<SyslogLine> lines = SyslogCapture::lines();
    for (const SyslogLine &line : lines) {
        if (line.priority == priority && line.text.endsWith(", " + message.toUtf8()))
            ++count;
    }
    return count;
}

// Lines of the priority whose message begins with the text.
QStringList loggedStartingWith(int priority, const QString &start)
{
    QStringList found;
    const QList<SyslogLine> lines = SyslogCapture::lines();
    for (const SyslogLine &line : lines) {
        const int begin = line.text.indexOf(", ") + 2;
        if (line.priority == priority && line.text.mid(begin).startsWith(start.toUtf8()))
            found.append(QString::fromUtf8(line.text.mid(begin)));
    }
    return found;
}

QList<uint> uidList(std::initializer_list<uint> uids)
{
    return QList<uint>(uids);
}
} // namespace

// DBusKestService in this process on a connection of its own, so that its messages can be read back: the
// Enable switch, the session sweep's failures, the session watch and the per-user registration.
class DBusKestSwitchTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        qInstallMessageHandler(messageHandler);
        QVERIFY2(m_bus.isRunning(), qPrintable(m_bus.errorText()));
        m_service = QDBusConnection::connectToBus(m_bus.address(), serviceConnection);
        m_client = QDBusConnection::connectToBus(m_bus.address(), clientConnection);
        QVERIFY(m_service.isConnected() && m_client.isConnected());
        QVERIFY(m_service.registerService(QStringLiteral("com.nimbal.kest.iam")));
        QVERIFY(m_root.isValid());
        QVERIFY2(m_peers.start(m_client), qPrintable(m_peers.errorText()));
    }

    void cleanupTestCase()
    {
        QDBusConnection::disconnectFromBus(serviceConnection);
        QDBusConnection::disconnectFromBus(clientConnection);
    }

    void init()
    {
        QVERIFY(m_peers.reset());
        QDir(m_root.workDir()).removeRecursively();
        QVERIFY(QDir().mkpath(m_root.workDir()));
        QVERIFY(m_root.writeSettings("[main]\nenable=true\n"));
        SyslogCapture::clear();
    }

    void enableWrites_data()
    {
        QTest::addColumn<QByteArray>("settings"); // before the writes; null: no settings file
        QTest::addColumn<QList<uint>>("cached");
        QTest::addColumn<QList<bool>>("writes");
        QTest::addColumn<QString>("failing");
        QTest::addColumn<QStringList>("calls"); // DeleteUser calls sorted, then the rest in order
        QTest::addColumn<int>("alreadyThere");
        QTest::addColumn<QList<uint>>("remaining");
        QTest::addColumn<QByteArray>("settingsAfter");

        const QList<uint> mixed = uidList({ 1005, 10001, 10002 });
        const QString deleteAlice = QStringLiteral("DeleteUser @user10001 true");
        const QString deleteBob = QStringLiteral("DeleteUser @user10002 true");
        const QString greeter = QStringLiteral("SwitchToUser {\"Type\":0,\"Uid\":0}");
        const QByteArray on("[main]\nenable=true\n");
        const QByteArray off("[main]\nenable=false\n");

        QTest::newRow("off twice") << on << mixed << QList<bool> { false, false } << QString()
                                   << QStringList { deleteAlice, deleteBob, greeter } << 1 << mixed << off;
        QTest::newRow("off, only local users") << on << uidList({ 1005, 999 }) << QList<bool> { false } << QString()
                                               << QStringList { greeter } << 0 << uidList({ 999, 1005 }) << off;
        QTest::newRow("on") << off << mixed << QList<bool> { true } << QString() << QStringList() << 0
                            << uidList({ 1005 }) << on;
        QTest::newRow("on twice") << off << mixed << QList<bool> { true, true } << QString() << QStringList() << 1
                                  << uidList({ 1005 }) << on;
        QTest::newRow("unchanged") << on << mixed << QList<bool> { true } << QString() << QStringList() << 1 << mixed
                                   << on;
        QTest::newRow("accounts daemon refuses")
            << on << mixed << QList<bool> { false } << QStringLiteral("DeleteUser")
            << QStringList { deleteAlice, deleteBob, greeter } << 0 << mixed << off;
        QTest::newRow("lock service refuses") << on << mixed << QList<bool> { false } << QStringLiteral("SwitchToUser")
                                              << QStringList { deleteAlice, deleteBob, greeter } << 0 << mixed << off;
        QTest::newRow("no settings file") << QByteArray() << mixed << QList<bool> { false } << QString()
                                          << QStringList() << 0 << mixed << QByteArray();
    }

    void enableWrites()
    {
        QFETCH(QByteArray, settings);
        QFETCH(QList<uint>, cached);
        QFETCH(QList<bool>, writes);
        QFETCH(QString, failing);
        QFETCH(QStringList, calls);
        QFETCH(int, alreadyThere);
        QFETCH(QList<uint>, remaining);
        QFETCH(QByteArray, settingsAfter);

        DBusKestService service(m_service);
        for (const uint uid : qAsConst(cached))
            QVERIFY(writeCacheRecord(testAccount(uid, QStringLiteral("@user") + QString::number(uid))));
        QVERIFY(settings.isNull() ? m_root.removeSettings() : m_root.writeSettings(settings));
        if (!failing.isEmpty())
            QVERIFY(m_peers.failMethod(failing));
        SyslogCapture::clear();

        for (const bool value : qAsConst(writes))
            QVERIFY(service.setProperty("Enable", value));

        QStringList asked = m_peers.calls();
        std::sort(asked.begin(), asked.begin() + asked.filter(QStringLiteral("DeleteUser ")).size());
        QCOMPARE(asked, calls);
        QCOMPARE(logged(LOG_WARNING, QStringLiteral("already in destination status.")), alreadyThere);
        QCOMPARE(cachedUids(), remaining);
        QCOMPARE(m_root.readFile(QStringLiteral("/etc/kest-iam.conf")), settingsAfter);

        const int deleteFailures = failing == QLatin1String("DeleteUser") ? 2 : 0;
        QCOMPARE(logged(LOG_WARNING, QStringLiteral("delete user data failed. error: DeleteUser failed on request")),
            deleteFailures);
        QCOMPARE(logged(LOG_WARNING, QStringLiteral("call ose-lockservice failed.")),
            failing == QLatin1String("SwitchToUser") ? 1 : 0);
        QCOMPARE(logged(LOG_CRIT,
                     QStringLiteral("critical error. cannot read configuration file ")
                         + m_root.filePath(QStringLiteral("/etc/kest-iam.conf"))),
            settings.isNull() ? 1 : 0);
    }

    void sweepMessages_data()
    {
        QTest::addColumn<QString>("failing");
        QTest::addColumn<QStringList>("warnings");

        QTest::newRow("session list refused")
            << QStringLiteral("ListSessions")
            << QStringList { QStringLiteral("[ syncLightDM ] call systemd-logind.  ListSessions failed on request") };
        QTest::newRow("session list unreadable")
            << QStringLiteral("ListSessionsGarbled")
            << QStringList { QStringLiteral("[ syncLightDM ] cannot get session list value.  ") };
        QTest::newRow("kill refused") << QStringLiteral("KillSession")
                                      << QStringList { QStringLiteral("[ syncLightDM ] terminate session failed.  "
                                                                      "KillSession failed on request"),
                                             QStringLiteral("[ syncLightDM ] terminate session failed.  "
                                                            "KillSession failed on request") };
    }

    void sweepMessages()
    {
        QFETCH(QString, failing);
        QFETCH(QStringList, warnings);

        QVERIFY(writeCacheRecord(testAccount(10001, QStringLiteral("@alice"))));
        QVERIFY(m_peers.addSession(QStringLiteral("c1"), 10001, QStringLiteral("@alice")));
        QVERIFY(m_peers.addSession(QStringLiteral("c2"), 10002, QStringLiteral("@bob")));
        QVERIFY(m_peers.addSession(QStringLiteral("c3"), 113, QStringLiteral("lightdm")));
        QVERIFY(m_peers.failMethod(failing));
        DBusKestService service(m_service);

        QVERIFY(service.RemoveCacheFile(10002));
        const QStringList found = loggedStartingWith(LOG_WARNING, QStringLiteral("[ syncLightDM ]"));
        QCOMPARE(found.size(), warnings.size());
        for (int i = 0; i < found.size(); ++i)
            QVERIFY2(found.at(i).startsWith(warnings.at(i)), qPrintable(found.at(i)));
    }

    void sessionMessages_data()
    {
        QTest::addColumn<QString>("userName"); // empty: a session logind does not know
        QTest::addColumn<bool>("rebuilt");

        QTest::newRow("greeter") << QStringLiteral("lightdm") << false;
        QTest::newRow("unknown session") << QString() << false;
        QTest::newRow("user") << QStringLiteral("@alice") << true;
        QTest::newRow("a name close to the greeter's") << QStringLiteral("LightDM") << true;
    }

    void sessionMessages()
    {
        QFETCH(QString, userName);
        QFETCH(bool, rebuilt);

        DBusKestService service(m_service);
        if (!userName.isEmpty())
            QVERIFY(m_peers.addSession(QStringLiteral("c5"), 10001, userName));
        QVERIFY(writeCacheRecord(testAccount(10001, QStringLiteral("@alice"))));
        const QString path = QStringLiteral("/org/freedesktop/login1/session/c5");
        SyslogCapture::clear();

        service.SessionNew(QStringLiteral("c5"), QDBusObjectPath(path));

        QCOMPARE(logged(LOG_DEBUG, QStringLiteral("session name: c5, session path: ") + path), 1);
        QCOMPARE(logged(LOG_DEBUG, QStringLiteral("no need rescan logined users for session change event.")),
            userName == QLatin1String("lightdm") ? 1 : 0);
        const QStringList unreadable = loggedStartingWith(LOG_WARNING,
            QStringLiteral("cannot get session user name, session: c5, path: ") + path + QStringLiteral(", error: "));
        QCOMPARE(unreadable.size(), userName.isEmpty() ? 1 : 0);
        QCOMPARE(
            logged(LOG_DEBUG, QStringLiteral("uid=10001userPath=/com/nimbal/kest/iam/user10001")), rebuilt ? 1 : 0);
        QCOMPARE(userProperty(m_client, 10001, QStringLiteral("UserName")).isValid(), rebuilt);
    }

    void userObjectWithoutEntry()
    {
        // A record marked for removal has a file but no user list entry.
        TestAccount marked = testAccount(10001, QStringLiteral("@alice"));
        marked.removeStatus = 1;
        QVERIFY(writeCacheRecord(marked));
        DBusKestService service(m_service);

        QVERIFY(service.registerUserObjects(m_service));
        QCOMPARE(logged(LOG_WARNING, QStringLiteral("There is no user that the id is uid.")), 1);
        QCOMPARE(userProperty(m_client, 10001, QStringLiteral("Uid")), QVariant(0u));
        QCOMPARE(userProperty(m_client, 10001, QStringLiteral("Gid")), QVariant(0u));
        for (const char *property : { "UserName", "Password", "HomeDir", "Shell", "Gecos" })
            QCOMPARE(userProperty(m_client, 10001, QLatin1String(property)), QVariant(QString()));
    }

    void registrationStopsAtFirstFailure()
    {
        QVERIFY(writeCacheRecords(
            { testAccount(10001, QStringLiteral("@alice")), testAccount(10002, QStringLiteral("@bob")) }));
        const QList<uint> order = listCacheUids();
        QObject squatter;
        QVERIFY(m_service.registerObject(userObjectPath(order.constFirst()), &squatter));
        DBusKestService service(m_service);

        QVERIFY(!service.registerUserObjects(m_service));
        QCOMPARE(
            loggedStartingWith(LOG_WARNING, QStringLiteral("register user dbus object failed. error: ")).size(), 1);
        QVERIFY(!userProperty(m_client, order.constLast(), QStringLiteral("Uid")).isValid());
        m_service.unregisterObject(userObjectPath(order.constFirst()));
    }

    void idListMessages_data()
    {
        QTest::addColumn<QByteArray>("settings");
        QTest::addColumn<int>("disabledWarnings");
        QTest::addColumn<int>("criticals");

        QTest::newRow("switch on") << QByteArray("[main]\nenable=true\n") << 0 << 0;
        QTest::newRow("switch off") << QByteArray("[main]\nenable=false\n") << 1 << 0;
        QTest::newRow("no settings file") << QByteArray() << 1 << 1;
    }

    void idListMessages()
    {
        QFETCH(QByteArray, settings);
        QFETCH(int, disabledWarnings);
        QFETCH(int, criticals);

        DBusKestService service(m_service);
        QVERIFY(writeCacheRecord(testAccount(10001, QStringLiteral("@alice"))));
        QVERIFY(settings.isNull() ? m_root.removeSettings() : m_root.writeSettings(settings));
        SyslogCapture::clear();

        const UidList uids = service.GetUserIdList();
        QCOMPARE(uids, disabledWarnings ? UidList() : UidList { 10001 });
        QCOMPARE(logged(LOG_WARNING, QStringLiteral("[GetUserIdList]: enable false")), disabledWarnings);
        QCOMPARE(logged(LOG_DEBUG, QStringLiteral("[GetUserIdList]: (10001)")), disabledWarnings ? 0 : 1);
        QCOMPARE(loggedStartingWith(LOG_CRIT, QStringLiteral("critical error. cannot read configuration file ")).size(),
            criticals);
    }

private:
    PrivateBus m_bus;
    TestRoot m_root;
    QDBusConnection m_service { QString() };
    QDBusConnection m_client { QString() };
    FakePeers m_peers;
};

QTEST_GUILESS_MAIN(DBusKestSwitchTest)
#include "test_dbuskestswitch.moc"
