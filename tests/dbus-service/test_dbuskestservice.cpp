#include "cachecontrolfactory.h"
#include "cachestore.h"
#include "fakepeers.h"
#include "privatebus.h"
#include "serviceprocess.h"
#include "testaccounts.h"
#include "testroot.h"

#include <QDBusArgument>
#include <QDBusReply>
#include <QDir>
#include <QFile>
#include <QTest>

namespace
{
const QList<TestAccount> threeUsers { testAccount(10001, QStringLiteral("@alice")),
    testAccount(10002, QStringLiteral("@bob")), testAccount(10003, QStringLiteral("@carol")) };

// What a session sweep asks logind: the session list, then one kill per listed session.
QStringList sweep(std::initializer_list<const char *> killedSessions)
{
    QStringList lines { QStringLiteral("ListSessions") };
    for (const char *id : killedSessions)
        lines.append(QStringLiteral("KillSession ") + QLatin1String(id) + QStringLiteral(" all 9"));
    return lines;
}

bool replyIsTrue(const QDBusMessage &reply)
{
    return reply.type() == QDBusMessage::ReplyMessage && reply.arguments().size() == 1
        && reply.arguments().constFirst().toBool();
}

QList<uint> uidsOf(const QDBusMessage &reply)
{
    if (reply.type() != QDBusMessage::ReplyMessage || reply.arguments().size() != 1)
        return { 0xffffffffu };
    return qdbus_cast<QList<uint>>(reply.arguments().constFirst());
}

quint32 removeStatusOf(uint uid)
{
    CacheControlPtr record = createCacheControl();
    record->setUid(uid);
    return loadCacheRecord(record) && record ? record->removeStatus() : 0xffffffffu;
}

const char *const allPolicyKeys = "[pw_strength]\n"
                                  "character_enable=true\n"
                                  "characters=abcXYZ\n"
                                  "contains_user=true\n"
                                  "lower=true\n"
                                  "max_length=20\n"
                                  "min_length=8\n"
                                  "number=true\n"
                                  "required=3\n"
                                  "special_enable=true\n"
                                  "special_string=\"!@#$%^&*\"\n"
                                  "strength=2\n"
                                  "upper=false\n"
                                  "[pw_validity]\n"
                                  "enable=true\n"
                                  "effective_time=90\n"
                                  "tip_time=7\n"
                                  "[pw_history_check]\n"
                                  "enable=true\n"
                                  "history_num=5\n"
                                  "[first_login]\n"
                                  "enable=true\n"
                                  "update_password=true\n"
                                  "[offline_login]\n"
                                  "enable=true\n"
                                  "cache_validity=30\n";
} // namespace

// The methods of the running dbus-kest, called over the private bus, with logind, the accounts daemon and
// the lock service played by kest-fake-peers.
class DBusKestServiceTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        QVERIFY2(m_bus.isRunning(), qPrintable(m_bus.errorText()));
        m_connection = QDBusConnection::connectToBus(m_bus.address(), QStringLiteral("service-test"));
        QVERIFY(m_connection.isConnected());
        QVERIFY(m_root.isValid());
        QVERIFY2(m_peers.start(m_connection), qPrintable(m_peers.errorText()));
    }

    void cleanupTestCase() { QDBusConnection::disconnectFromBus(QStringLiteral("service-test")); }

    void init()
    {
        QVERIFY(m_peers.reset());
        QDir(m_root.workDir()).removeRecursively();
        QVERIFY(QDir().mkpath(m_root.workDir()));
        QVERIFY(m_root.writeSettings("[main]\nenable=true\n"));
    }

    void removal_data()
    {
        QTest::addColumn<QString>("method");
        QTest::addColumn<QVariantList>("arguments");
        QTest::addColumn<bool>("enabled");
        QTest::addColumn<QString>("failing"); // a member of the fake peers that answers with an error
        QTest::addColumn<QList<uint>>("remaining");
        QTest::addColumn<QStringList>("calls");
        QTest::addColumn<bool>("objectsKept");

        const QString removeOne = QStringLiteral("RemoveCacheFile");
        const QString removeOthers = QStringLiteral("RemoveCacheFilesNotInList");
        const QString removeAll = QStringLiteral("RemoveAllCacheFiles");
        const QString list = QStringLiteral("ListSessions");
        const QVariant onlyAlice = QVariant::fromValue(QList<uint> { 10001 });
        const QVariant nobody = QVariant::fromValue(QList<uint>());
        const QVariant onlyCarol = QVariant::fromValue(QList<uint> { 10003 });

        // Sessions: c1 @alice (10001), c2 @bob (10002), c3 the greeter, c4 a local user.
        QTest::newRow("one, switch on") << removeOne << QVariantList { 10002u } << true << QString()
                                        << QList<uint> { 10001, 10003 } << sweep({ "c2", "c3", "c4" }) << true;
        QTest::newRow("one, switch off") << removeOne << QVariantList { 10002u } << false << QString()
                                         << QList<uint> { 10001, 10003 } << QStringList() << true;
        QTest::newRow("one without a record") << removeOne << QVariantList { 20000u } << true << QString()
                                              << QList<uint> { 10001, 10002, 10003 } << sweep({ "c3", "c4" }) << true;
        QTest::newRow("not in list, switch on") << removeOthers << QVariantList { onlyAlice } << true << QString()
                                                << QList<uint> { 10001 } << sweep({ "c2", "c3", "c4" }) << true;
        QTest::newRow("not in an empty list") << removeOthers << QVariantList { nobody } << true << QString()
                                              << QList<uint>() << sweep({ "c1", "c2", "c3", "c4" }) << true;
        QTest::newRow("not in list, switch off") << removeOthers << QVariantList { onlyCarol } << false << QString()
                                                 << QList<uint> { 10003 } << QStringList() << true;
        QTest::newRow("all, switch on") << removeAll << QVariantList() << true << QString() << QList<uint>()
                                        << sweep({ "c1", "c2", "c3", "c4" }) << false;
        QTest::newRow("all, switch off") << removeAll << QVariantList() << false << QString() << QList<uint>()
                                         << QStringList() << false;
        QTest::newRow("session list refused")
            << removeAll << QVariantList() << true << list << QList<uint>() << sweep({}) << false;
        QTest::newRow("session list unreadable")
            << removeAll << QVariantList() << true << QStringLiteral("ListSessionsGarbled") << QList<uint>()
            << sweep({}) << false;
        QTest::newRow("kills refused") << removeAll << QVariantList() << true << QStringLiteral("KillSession")
                                       << QList<uint>() << sweep({ "c1", "c2", "c3", "c4" }) << false;
    }

    void removal()
    {
        QFETCH(QString, method);
        QFETCH(QVariantList, arguments);
        QFETCH(bool, enabled);
        QFETCH(QString, failing);
        QFETCH(QList<uint>, remaining);
        QFETCH(QStringList, calls);
        QFETCH(bool, objectsKept);

        QVERIFY(writeCacheRecords(threeUsers));
        QVERIFY(m_peers.addSession(QStringLiteral("c1"), 10001, QStringLiteral("@alice")));
        QVERIFY(m_peers.addSession(QStringLiteral("c2"), 10002, QStringLiteral("@bob")));
        QVERIFY(m_peers.addSession(QStringLiteral("c3"), 113, QStringLiteral("lightdm")));
        QVERIFY(m_peers.addSession(QStringLiteral("c4"), 1000, QStringLiteral("localuser")));
        if (!failing.isEmpty())
            QVERIFY(m_peers.failMethod(failing));
        ServiceProcess service;
        QVERIFY(service.start());
        QVERIFY(service.waitUntilServing(m_connection));
        QCOMPARE(userProperty(m_connection, 10002, QStringLiteral("Uid")), QVariant(10002u));
        // Switched off behind the running service's back, so that the start-up clean-up left the records.
        if (!enabled)
            QVERIFY(m_root.writeSettings("[main]\nenable=false\n"));

        QVERIFY(replyIsTrue(callService(m_connection, method, arguments)));
        QCOMPARE(cachedUids(), remaining);
        QCOMPARE(m_peers.calls(), calls);
        QCOMPARE(userProperty(m_connection, 10002, QStringLiteral("Uid")).isValid(), objectsKept);
        QVERIFY(service.stop());
    }

    void disableTerminal_data()
    {
        QTest::addColumn<bool>("enabled");
        QTest::addColumn<uint>("uid");
        QTest::addColumn<bool>("expectedReply");
        QTest::addColumn<quint32>("expectedStatus"); // 0xffffffff: no record file

        QTest::newRow("cached, switch on") << true << 10002u << true << 1u;
        QTest::newRow("no record, switch on") << true << 20000u << true << 0xffffffffu;
        QTest::newRow("cached, switch off") << false << 10002u << false << 0u;
    }

    void disableTerminal()
    {
        QFETCH(bool, enabled);
        QFETCH(uint, uid);
        QFETCH(bool, expectedReply);
        QFETCH(quint32, expectedStatus);

        QVERIFY(writeCacheRecords(threeUsers));
        QVERIFY(m_peers.addSession(QStringLiteral("c2"), 10002, QStringLiteral("@bob")));
        ServiceProcess service;
        QVERIFY(service.start());
        QVERIFY(service.waitUntilServing(m_connection));
        if (!enabled)
            QVERIFY(m_root.writeSettings("[main]\nenable=false\n"));

        const QDBusMessage reply = callService(m_connection, QStringLiteral("DisableTerminal"), { uid });
        QCOMPARE(reply.type(), QDBusMessage::ReplyMessage);
        QCOMPARE(reply.arguments().constFirst().toBool(), expectedReply);
        QCOMPARE(removeStatusOf(uid), expectedStatus);
        QCOMPARE(cachedUids(), (QList<uint> { 10001, 10002, 10003 }));
        // Marking a record is not a removal: no session is touched.
        QCOMPARE(m_peers.calls(), QStringList());
        QVERIFY(service.stop());
    }

    void getUserIdList_data()
    {
        QTest::addColumn<bool>("enabled");
        QTest::newRow("switch on") << true;
        QTest::newRow("switch off") << false;
    }

    void getUserIdList()
    {
        QFETCH(bool, enabled);

        ServiceProcess service;
        QVERIFY(service.start());
        QVERIFY(service.waitUntilServing(m_connection));
        for (const uint uid : { 10030u, 10001u, 65534u, 10200u, 10002u, 99999u })
            QVERIFY(writeCacheRecord(testAccount(uid, QStringLiteral("@user") + QString::number(uid))));
        QVERIFY(m_root.writeFile(QStringLiteral("/var/lib/libkest-iam/10001.bak"), "not a record"));
        if (!enabled)
            QVERIFY(m_root.writeSettings("[main]\nenable=false\n"));

        const QList<quint32> listing = listCacheUids();
        const QList<uint> expected = enabled ? QList<uint>(listing.cbegin(), listing.cend()) : QList<uint>();
        QCOMPARE(uidsOf(callService(m_connection, QStringLiteral("GetUserIdList"))), expected);
        QVERIFY(service.stop());
    }

    void getUserGroups_data()
    {
        QTest::addColumn<bool>("enabled");
        QTest::addColumn<QString>("user");
        QTest::addColumn<QStringList>("groups");

        QTest::newRow("member of two") << true << QStringLiteral("@alice")
                                       << QStringList { QStringLiteral("kest"), QStringLiteral("lp") };
        QTest::newRow("other member") << true << QStringLiteral("@bob")
                                      << QStringList { QStringLiteral("kest"), QStringLiteral("plotters") };
        QTest::newRow("member of none") << true << QStringLiteral("@nobody") << QStringList();
        QTest::newRow("switch off") << false << QStringLiteral("@alice") << QStringList();
    }

    void getUserGroups()
    {
        QFETCH(bool, enabled);
        QFETCH(QString, user);
        QFETCH(QStringList, groups);

        QVERIFY(m_root.writeFile(QStringLiteral("/var/lib/libkest-iam/groups.txt"),
            "kest:x:10000:@alice,@bob\nlp:x:7:@alice,\nplotters:x:5003:@bob,\n"));
        if (!enabled)
            QVERIFY(m_root.writeSettings("[main]\nenable=false\n"));
        ServiceProcess service;
        QVERIFY(service.start());
        QVERIFY(service.waitUntilServing(m_connection));

        const QDBusReply<QStringList> reply = callService(m_connection, QStringLiteral("GetUserGroups"), { user });
        QVERIFY2(reply.isValid(), qPrintable(reply.error().message()));
        QCOMPARE(reply.value(), groups);
        QVERIFY(service.stop());
    }

    void userObjectsFollowSessions()
    {
        const TestAccount alice = testAccount(10001, QStringLiteral("@alice"));
        TestAccount bob = testAccount(10002, QStringLiteral("@bob"));
        bob.gecos = QStringLiteral("Bob Ünicode, Room 7");
        QVERIFY(writeCacheRecords({ alice, bob }));
        ServiceProcess service;
        QVERIFY(service.start());
        QVERIFY(service.waitUntilServing(m_connection));

        for (const TestAccount &account : { alice, bob }) {
            QCOMPARE(userProperty(m_connection, account.uid, QStringLiteral("Uid")), QVariant(account.uid));
            QCOMPARE(userProperty(m_connection, account.uid, QStringLiteral("Gid")), QVariant(account.gid));
            QCOMPARE(userProperty(m_connection, account.uid, QStringLiteral("UserName")), QVariant(account.name));
            QCOMPARE(userProperty(m_connection, account.uid, QStringLiteral("Password")), QVariant(account.password));
            QCOMPARE(userProperty(m_connection, account.uid, QStringLiteral("HomeDir")), QVariant(account.home));
            QCOMPARE(userProperty(m_connection, account.uid, QStringLiteral("Shell")), QVariant(account.shell));
            QCOMPARE(userProperty(m_connection, account.uid, QStringLiteral("Gecos")), QVariant(account.gecos));
        }

        // A record that appears later is published only by a rebuild.
        QVERIFY(writeCacheRecord(testAccount(10003, QStringLiteral("@carol"))));
        QVERIFY(m_peers.addSession(QStringLiteral("c7"), 113, QStringLiteral("lightdm")));
        announce(QStringLiteral("c7"));
        QVERIFY(m_peers.calls().contains(QStringLiteral("GetName c7")));
        QVERIFY(!userProperty(m_connection, 10003, QStringLiteral("Uid")).isValid());

        // A session that cannot be read changes nothing either.
        announce(QStringLiteral("ghost"));
        QVERIFY(!userProperty(m_connection, 10003, QStringLiteral("Uid")).isValid());

        QVERIFY(m_peers.addSession(QStringLiteral("c8"), 10001, QStringLiteral("@alice")));
        announce(QStringLiteral("c8"));
        QCOMPARE(userProperty(m_connection, 10003, QStringLiteral("UserName")), QVariant(QStringLiteral("@carol")));

        // Local users' sessions rebuild too, and a rebuild drops objects whose record is gone.
        removeCacheFile(10002);
        QVERIFY(m_peers.addSession(QStringLiteral("c9"), 1000, QStringLiteral("localuser")));
        announce(QStringLiteral("c9"));
        QVERIFY(!userProperty(m_connection, 10002, QStringLiteral("Uid")).isValid());
        QCOMPARE(userProperty(m_connection, 10001, QStringLiteral("Uid")), QVariant(10001u));

        QVERIFY(m_root.writeSettings("[main]\nenable=false\n"));
        announce(QStringLiteral("c8"));
        for (const uint uid : { 10001u, 10002u, 10003u })
            QVERIFY2(
                !userProperty(m_connection, uid, QStringLiteral("Uid")).isValid(), qPrintable(QString::number(uid)));
        QVERIFY(service.stop());
    }

    void startedSwitchedOff()
    {
        QVERIFY(writeCacheRecords(threeUsers));
        QVERIFY(writeCacheRecord(testAccount(1005, QStringLiteral("localuser"))));
        QVERIFY(m_root.writeSettings("[main]\nenable=false\n"));
        ServiceProcess service;
        QVERIFY(service.start());
        QVERIFY(service.waitUntilServing(m_connection));
        QCOMPARE(cachedUids(), QList<uint> { 1005 });

        // Switching on later does not start the session watch: a new session rebuilds nothing.
        QVERIFY(m_root.writeSettings("[main]\nenable=true\n"));
        QVERIFY(writeCacheRecord(testAccount(10001, QStringLiteral("@alice"))));
        QVERIFY(m_peers.addSession(QStringLiteral("c8"), 10001, QStringLiteral("@alice")));
        announce(QStringLiteral("c8"));
        QCOMPARE(m_peers.calls(), QStringList());
        QVERIFY(!userProperty(m_connection, 10001, QStringLiteral("Uid")).isValid());
        QVERIFY(service.stop());
    }

    void enableOverTheBus()
    {
        QVERIFY(writeCacheRecords(threeUsers));
        QVERIFY(writeCacheRecord(testAccount(1005, QStringLiteral("localuser"))));
        ServiceProcess service;
        QVERIFY(service.start());
        QVERIFY(service.waitUntilServing(m_connection));

        QCOMPARE(setEnableProperty(m_connection, false).type(), QDBusMessage::ReplyMessage);
        QStringList deleted = m_peers.callsStartingWith(QStringLiteral("DeleteUser "));
        deleted.sort();
        QCOMPARE(deleted,
            QStringList({ QStringLiteral("DeleteUser @alice true"), QStringLiteral("DeleteUser @bob true"),
                QStringLiteral("DeleteUser @carol true") }));
        QCOMPARE(m_peers.calls().constLast(), QStringLiteral("SwitchToUser {\"Type\":0,\"Uid\":0}"));
        QCOMPARE(cachedUids(), (QList<uint> { 1005, 10001, 10002, 10003 }));
        QCOMPARE(enableProperty(), QVariant(false));

        QVERIFY(m_peers.reset());
        QCOMPARE(setEnableProperty(m_connection, true).type(), QDBusMessage::ReplyMessage);
        QCOMPARE(enableProperty(), QVariant(true));
        QCOMPARE(cachedUids(), QList<uint> { 1005 });
        QCOMPARE(m_peers.calls(), QStringList());
        QVERIFY(service.stop());
    }

    void queryPasswordConfig_data()
    {
        QTest::addColumn<QByteArray>("settings"); // null: no settings file
        QTest::addColumn<QString>("expected");

        const QString empty = QStringLiteral(
            "{\"first_login\":{\"enable\":false,\"update_password\":false},"
            "\"offline_login\":{\"cache_validity\":0,\"enable\":false},"
            "\"pw_history_check\":{\"enable\":false,\"history_num\":0},"
            "\"pw_strength\":{\"character_enable\":false,\"characters\":\"\",\"contains_user\":false,\"lower\":false,"
            "\"max_length\":0,\"min_length\":0,\"number\":false,\"required\":0,\"special_enable\":false,"
            "\"special_string\":\"\",\"strength\":false,\"upper\":false},"
            "\"pw_validity\":{\"effective_time\":0,\"enable\":false,\"tip_time\":0}}");
        QTest::newRow("no settings file") << QByteArray() << empty;
        QTest::newRow("no policy keys") << QByteArray("[main]\nenable=true\n") << empty;
        QTest::newRow("every key") << QByteArray(allPolicyKeys)
                                   << QStringLiteral(
                                          "{\"first_login\":{\"enable\":true,\"update_password\":true},"
                                          "\"offline_login\":{\"cache_validity\":30,\"enable\":true},"
                                          "\"pw_history_check\":{\"enable\":true,\"history_num\":5},"
                                          "\"pw_strength\":{\"character_enable\":true,\"characters\":\"abcXYZ\","
                                          "\"contains_user\":true,\"lower\":true,\"max_length\":20,\"min_length\":8,"
                                          "\"number\":true,\"required\":3,\"special_enable\":true,"
                                          "\"special_string\":\"!@#$%^&*\",\"strength\":true,\"upper\":false},"
                                          "\"pw_validity\":{\"effective_time\":90,\"enable\":true,\"tip_time\":7}}");
        QTest::newRow("numbers that are not numbers")
            << QByteArray("[pw_strength]\nmax_length=long\nstrength=0\n[offline_login]\ncache_validity=-3\n")
            << QString(empty).replace(QStringLiteral("\"cache_validity\":0"), QStringLiteral("\"cache_validity\":-3"));
    }

    void queryPasswordConfig()
    {
        QFETCH(QByteArray, settings);
        QFETCH(QString, expected);

        ServiceProcess service;
        QVERIFY(service.start());
        QVERIFY(service.waitUntilServing(m_connection));
        QVERIFY(settings.isNull() ? m_root.removeSettings() : m_root.writeSettings(settings));

        const QDBusReply<QString> reply = callService(m_connection, QStringLiteral("QueryPasswordConfig"));
        QVERIFY2(reply.isValid(), qPrintable(reply.error().message()));
        QCOMPARE(reply.value(), expected);
        QVERIFY(service.stop());
    }

    void modifyUserPassword_data()
    {
        QTest::addColumn<QByteArray>("standIn"); // the shell body of a program named cache-kest; null: none
        QTest::addColumn<QString>("expected");

        QTest::newRow("cache-kest not found") << QByteArray() << QString();
        QTest::newRow("arguments as given")
            << QByteArray("printf '%s\\n' \"$#\" \"$@\"")
            << QStringLiteral(
                   "2\n--modify-user-passwd\n"
                   "{\"old_password\":\"old $HOME pw\",\"password\":\"n\\\"w; pw\",\"username\":\"@alice\"}\n");
        QTest::newRow("output up to a zero byte")
            << QByteArray("printf '{\"code\":0}\\000trailing'") << QStringLiteral("{\"code\":0}");
        QTest::newRow("failing program") << QByteArray("echo partial; exit 1") << QStringLiteral("partial\n");
    }

    void modifyUserPassword()
    {
        QFETCH(QByteArray, standIn);
        QFETCH(QString, expected);

        QTemporaryDir programs;
        if (!standIn.isNull()) {
            QFile program(programs.filePath(QStringLiteral("cache-kest")));
            QVERIFY(program.open(QIODevice::WriteOnly));
            program.write("#!/bin/sh\n" + standIn + "\n");
            program.close();
            QVERIFY(program.setPermissions(QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ExeOwner));
        }
        ServiceProcess service;
        service.setSearchPath(programs.path() + QStringLiteral(":/usr/bin:/bin"));
        QVERIFY(service.start());
        QVERIFY(service.waitUntilServing(m_connection));

        const QDBusReply<QString> reply = callService(m_connection, QStringLiteral("ModifyUserPassword"),
            { QStringLiteral("@alice"), QStringLiteral("old $HOME pw"), QStringLiteral("n\"w; pw") });
        QVERIFY2(reply.isValid(), qPrintable(reply.error().message()));
        QCOMPARE(reply.value(), expected);
        QVERIFY(service.stop());
    }

private:
    // The bus hands the service the signal before this test's next call, so the call after the announcement
    // is answered once the session has been handled.
    void announce(const QString &sessionId)
    {
        QVERIFY(m_peers.emitSessionNew(sessionId));
        QVERIFY(callService(m_connection, QStringLiteral("GetUserIdList")).type() == QDBusMessage::ReplyMessage);
    }

    QVariant enableProperty() const
    {
        QDBusMessage call = QDBusMessage::createMethodCall(ServiceProcess::serviceName(), servicePath(),
            QStringLiteral("org.freedesktop.DBus.Properties"), QStringLiteral("Get"));
        call << QStringLiteral("com.nimbal.kest.iam") << QStringLiteral("Enable");
        const QDBusReply<QDBusVariant> reply = m_connection.call(call);
        return reply.isValid() ? reply.value().variant() : QVariant();
    }

    PrivateBus m_bus;
    TestRoot m_root;
    QDBusConnection m_connection { QString() };
    FakePeers m_peers;
};

QTEST_GUILESS_MAIN(DBusKestServiceTest)
#include "test_dbuskestservice.moc"
