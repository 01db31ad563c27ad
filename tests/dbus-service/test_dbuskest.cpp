#include "cachecontrolfactory.h"
#include "cachedaemonfixture.h"
#include "cachestore.h"
#include "dbuskestservice.h"
#include "domainserverfixture.h"
#include "messagehandler.h"
#include "privatebus.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QDBusConnectionInterface>
#include <QDBusVariant>
#include <QDBusVirtualObject>
#include <QDir>
#include <QJsonDocument>
#include <QJsonObject>
#include <QMutex>
#include <QProcess>
#include <QTest>
#include <QThread>
#include <QXmlStreamReader>

#include <algorithm>
#include <grp.h>
#include <syslog.h>
#include <utility>

namespace
{
const QString kName = QStringLiteral("com.nimbal.kest.iam");
const QString kPath = QStringLiteral("/com/nimbal/kest/iam");
const QString kLogind = QStringLiteral("/org/freedesktop/login1");
const QString kSettings = QStringLiteral("/etc/kest-iam.conf");
const QByteArray kOn("[main]\nenable=true\n");
const QByteArray kOff("[main]\nenable=false\n");
const QStringList kNobody { QStringLiteral("setpriv"), QStringLiteral("--reuid=65534"),
    QStringLiteral("--regid=65534") };

// What the stand-ins were asked, in order, and the members told to refuse; they answer on a thread of their own.
QMutex peersLock;
QStringList peerCalls;
QString refusedMember;

QStringList takeCalls()
{
    QMutexLocker locker(&peersLock);
    return std::exchange(peerCalls, QStringList());
}

bool writeRecord(uint uid, const QString &name, uint removeStatus = 0)
{
    CacheControlPtr record = createCacheControl();
    record->setVersion(kCacheVersion1_0);
    record->setUid(uid);
    record->setAccount(name);
    record->setMainGid(uid + 100);
    record->setPassword(QStringLiteral("digest-of-") + name);
    record->setHomePath(QStringLiteral("/home/remote/") + name);
    record->setLoginShell(QStringLiteral("/bin/zsh"));
    record->setGecos(QStringLiteral("Full Name of ") + name);
    record->setRemoveStatus(removeStatus);
    return saveCacheRecord(*record);
}

QList<uint> cachedUids()
{
    const QList<quint32> listed = listCacheUids();
    QList<uint> uids(listed.cbegin(), listed.cend());
    std::sort(uids.begin(), uids.end());
    return uids;
}

quint32 removeStatusOf(uint uid)
{
    CacheControlPtr record = createCacheControl();
    record->setUid(uid);
    return loadCacheRecord(record) && record ? record->removeStatus() : 0xffffffffu;
}

QStringList sweep(const QString &killed)
{
    QStringList lines { QStringLiteral("ListSessions") };
    const QStringList ids = killed.split(QLatin1Char(' '), Qt::SkipEmptyParts);
    for (const QString &id : ids)
        lines.append(QStringLiteral("KillSession ") + id + QStringLiteral(" all 9"));
    return lines;
}

// Warnings and critical messages, without the "cpu time: N, " prefix.
QStringList logged()
{
    QStringList found;
    const QList<SyslogLine> lines = SyslogCapture::lines();
    for (const SyslogLine &line : lines) {
        if (line.priority == LOG_WARNING || line.priority == LOG_CRIT)
            found.append(QString::fromUtf8(line.text.mid(line.text.indexOf(", ") + 2)));
    }
    return found;
}

// One line per member, argument and annotation of the interface, plus the child nodes, in document order.
QStringList members(const QByteArray &xml, const QString &interface)
{
    QXmlStreamReader reader(xml);
    QStringList lines;
    bool inside = false;
    while (!reader.atEnd()) {
        reader.readNext();
        if (reader.isEndElement() && reader.name() == QLatin1String("interface"))
            inside = false;
        if (!reader.isStartElement())
            continue;
        const QXmlStreamAttributes attributes = reader.attributes();
        QString line = reader.name().toString();
        for (const char *key : { "name", "type", "direction", "access", "value" })
            line += QLatin1Char(' ') + attributes.value(QLatin1String(key));
        if (reader.name() == QLatin1String("interface"))
            inside = attributes.value(QLatin1String("name")) == interface;
        else if (inside || (reader.name() == QLatin1String("node") && attributes.hasAttribute(QLatin1String("name"))))
            lines.append(line.trimmed());
    }
    return lines;
}
} // namespace

// logind, the accounts daemon and the lock service as dbus-kest sees them, on a thread of their own since the service
// calls them blocking: every call is recorded ("KillSession c2 all 9") and answered, with an error when refused.
class Peers : public QDBusVirtualObject
{
public:
    QString introspect(const QString &path) const override
    {
        return path != kLogind
            ? QString()
            : QStringLiteral("<interface name=\"org.freedesktop.login1.Manager\"><signal name=\"SessionNew\">"
                             "<arg type=\"s\"/><arg type=\"o\"/></signal></interface>");
    }

    bool handleMessage(const QDBusMessage &message, const QDBusConnection &connection) override
    {
        const QString member = message.member();
        if (member == QLatin1String("Introspect"))
            return false;
        SessionList sessions; // c1 @alice, c2 @bob, c3 the greeter, c4 a local user
        const QStringList users { QStringLiteral("@alice"), QStringLiteral("@bob"), QStringLiteral("lightdm"),
            QStringLiteral("localuser") };
        const uint uids[] { 10001, 10002, 113, 1000 };
        for (int i = 0; i < users.size(); ++i) {
            const QString id = QStringLiteral("c") + QString::number(i + 1);
            sessions.append({ id, uids[i], users.at(i), QStringLiteral("seat0"),
                QDBusObjectPath(kLogind + QStringLiteral("/session/") + id) });
            if (member == QLatin1String("Get") && message.path() == sessions.constLast().sessionPath.path())
                return connection.send(message.createReply(QVariant::fromValue(QDBusVariant(users.at(i)))));
        }
        QStringList call { member };
        const QVariantList arguments = message.arguments();
        for (const QVariant &argument : arguments)
            call.append(argument.toString());
        QMutexLocker locker(&peersLock);
        peerCalls.append(call.join(QLatin1Char(' ')));
        if (member == refusedMember)
            return connection.send(message.createErrorReply(QDBusError::Failed, member + QStringLiteral(" refused")));
        return connection.send(member == QLatin1String("ListSessions")
                ? message.createReply(QVariant::fromValue(sessions))
                : message.createReply());
    }
};

// dbus-kest as a process on a private system bus; logind, the accounts daemon and the lock service are played by
// objects of this test. One instance serves every check; the checks that need its log run the service object here.
class DBusKestTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        registerKestDBusTypes();
        QVERIFY2(m_bus.isRunning(), qPrintable(m_bus.errorText()));
        QVERIFY(m_bus.openToOtherUsers());
        m_conn = QDBusConnection::connectToBus(m_bus.address(), QStringLiteral("test"));
        QVERIFY(m_conn.registerVirtualObject(QStringLiteral("/"), &m_peers, QDBusConnection::SubPath));
        m_peers.moveToThread(&m_thread);
        m_thread.start();
        for (const char *name :
            { "org.freedesktop.login1", "com.nimbal.daemon.Accounts", "com.nimbal.ose.LockService" })
            QVERIFY(m_conn.registerService(QLatin1String(name)));

        QVERIFY(m_root.writeSettings(kOn));
        QVERIFY(writeRecord(10001, QStringLiteral("@alice")) && writeRecord(10002, QStringLiteral("@bob")));
        QVERIFY(m_root.writeFile(QStringLiteral("/run/dbus-kest.pid"), "99999\n"));
        start(m_idle, { QStringLiteral("idle") });
        start(m_main);
        QTRY_COMPARE_WITH_TIMEOUT(m_conn.interface()->servicePid(kName).value(), uint(m_main.processId()), 15000);
        QVERIFY(!QFile::exists(m_root.filePath(QStringLiteral("/run/dbus-kest.pid"))));
        qInstallMessageHandler(messageHandler);
    }

    void cleanupTestCase()
    {
        for (QProcess *process : { &m_main, &m_idle }) {
            process->terminate();
            process->waitForFinished();
        }
        m_conn.unregisterObject(QStringLiteral("/"));
        m_thread.quit();
        m_thread.wait();
    }

    void init()
    {
        QDir(m_root.workDir()).removeRecursively();
        QVERIFY(m_root.writeFile(QStringLiteral("/var/lib/libkest-iam/groups.txt"),
            "kest:x:10000:@alice,@bob\nlp:x:7:@alice,\nplotters:x:5003:@bob,\n"));
        QVERIFY(m_root.writeSettings(kOn));
        QVERIFY(writeRecord(10001, QStringLiteral("@alice")) && writeRecord(10002, QStringLiteral("@bob")));
        QMutexLocker locker(&peersLock);
        peerCalls.clear();
        refusedMember.clear();
    }

    void introspection_data()
    {
        QTest::addColumn<QString>("path");
        QTest::addColumn<QString>("interface");
        QTest::addColumn<QStringList>("children");

        QTest::newRow("main") << kPath << kName
                              << QStringList { QStringLiteral("node user10001"), QStringLiteral("node user10002") };
        QTest::newRow("per user") << kPath + QStringLiteral("/user10002") << kName + QStringLiteral(".user")
                                  << QStringList();
    }

    void introspection()
    {
        QFETCH(QString, path);
        QFETCH(QString, interface);
        QFETCH(QStringList, children);

        QFile file(QStringLiteral(KEST_INTERFACES_DIR "/") + interface + QStringLiteral(".xml"));
        QVERIFY(file.open(QIODevice::ReadOnly));
        const QStringList recorded = members(file.readAll(), interface);
        QVERIFY(!recorded.isEmpty());
        QProcess gdbus;
        gdbus.start(QStringLiteral("gdbus"),
            { QStringLiteral("introspect"), QStringLiteral("--system"), QStringLiteral("--dest"), kName,
                QStringLiteral("--object-path"), path, QStringLiteral("--xml") });
        QVERIFY(gdbus.waitForFinished(30000) && gdbus.exitCode() == 0);
        QCOMPARE(members(gdbus.readAllStandardOutput(), interface), recorded + children);
    }

    void userObjects()
    {
        for (const uint uid : { 10001u, 10002u }) {
            const QString name = uid == 10001 ? QStringLiteral("@alice") : QStringLiteral("@bob");
            const QVariantList expected { uid, uid + 100, name, QStringLiteral("digest-of-") + name,
                QStringLiteral("/home/remote/") + name, QStringLiteral("/bin/zsh"),
                QStringLiteral("Full Name of ") + name };
            QVariantList read;
            for (const char *property : { "Uid", "Gid", "UserName", "Password", "HomeDir", "Shell", "Gecos" })
                read.append(userProperty(uid, QLatin1String(property)));
            QCOMPARE(read, expected);
        }
        // A record marked for removal has no user list entry: its object reads as zero and empty text.
        QVERIFY(writeRecord(10003, QStringLiteral("@carol"), 1));
        announce("c3");
        QVERIFY(!userProperty(10003, QStringLiteral("Uid")).isValid());
        announce("c4");
        QCOMPARE(userProperty(10003, QStringLiteral("Uid")), QVariant(0u));
        QCOMPARE(userProperty(10003, QStringLiteral("UserName")), QVariant(QString()));
        QVERIFY(m_root.writeSettings(kOff));
        announce("c1");
        for (const uint uid : { 10001u, 10002u, 10003u })
            QVERIFY(!userProperty(uid, QStringLiteral("Uid")).isValid());
    }

    void removal_data()
    {
        QTest::addColumn<QString>("method");
        QTest::addColumn<QVariantList>("arguments");
        QTest::addColumn<bool>("enabled");
        QTest::addColumn<QList<uint>>("remaining");
        QTest::addColumn<QStringList>("calls");
        QTest::addColumn<bool>("objectsKept");

        const QString one = QStringLiteral("RemoveCacheFile");
        const QString others = QStringLiteral("RemoveCacheFilesNotInList");
        const QString all = QStringLiteral("RemoveAllCacheFiles");
        const auto list = [](const QList<uint> &uids) { return QVariantList { QVariant::fromValue(uids) }; };

        QTest::newRow("one, on") << one << QVariantList { 10002u } << true << QList<uint> { 10001, 10003 }
                                 << sweep(QStringLiteral("c2 c3 c4")) << true;
        QTest::newRow("one, off") << one << QVariantList { 10002u } << false << QList<uint> { 10001, 10003 }
                                  << QStringList() << true;
        QTest::newRow("one without a record")
            << one << QVariantList { 20000u } << true << QList<uint> { 10001, 10002, 10003 }
            << sweep(QStringLiteral("c3 c4")) << true;
        QTest::newRow("not in list, on") << others << list({ 10001 }) << true << QList<uint> { 10001 }
                                         << sweep(QStringLiteral("c2 c3 c4")) << true;
        QTest::newRow("not in an empty list")
            << others << list({}) << true << QList<uint>() << sweep(QStringLiteral("c1 c2 c3 c4")) << true;
        QTest::newRow("not in list, off")
            << others << list({ 10003 }) << false << QList<uint> { 10003 } << QStringList() << true;
        QTest::newRow("all, on") << all << QVariantList() << true << QList<uint>()
                                 << sweep(QStringLiteral("c1 c2 c3 c4")) << false;
        QTest::newRow("all, off") << all << QVariantList() << false << QList<uint>() << QStringList() << false;
    }

    void removal()
    {
        QFETCH(QString, method);
        QFETCH(QVariantList, arguments);
        QFETCH(bool, enabled);
        QFETCH(QList<uint>, remaining);
        QFETCH(QStringList, calls);
        QFETCH(bool, objectsKept);

        QVERIFY(writeRecord(10003, QStringLiteral("@carol")));
        announce("c1");
        QVERIFY(m_root.writeSettings(enabled ? kOn : kOff));
        takeCalls();
        QVERIFY(call(method, arguments));
        QCOMPARE(m_result, QVariant(true));
        QCOMPARE(cachedUids(), remaining);
        QCOMPARE(takeCalls(), calls);
        QCOMPARE(userProperty(10002, QStringLiteral("Uid")).isValid(), objectsKept);
    }

    void disableTerminal_data()
    {
        QTest::addColumn<bool>("enabled");
        QTest::addColumn<uint>("uid");
        QTest::addColumn<bool>("reply");
        QTest::addColumn<quint32>("status"); // 0xffffffff: no record file

        QTest::newRow("cached, on") << true << 10002u << true << 1u;
        QTest::newRow("no record, on") << true << 20000u << true << 0xffffffffu;
        QTest::newRow("cached, off") << false << 10002u << false << 0u;
    }

    void disableTerminal()
    {
        QFETCH(bool, enabled);
        QFETCH(uint, uid);
        QFETCH(bool, reply);
        QFETCH(quint32, status);

        QVERIFY(m_root.writeSettings(enabled ? kOn : kOff));
        QVERIFY(call(QStringLiteral("DisableTerminal"), { uid }));
        QCOMPARE(m_result, QVariant(reply));
        QCOMPARE(removeStatusOf(uid), status);
        QCOMPARE(cachedUids(), (QList<uint> { 10001, 10002 }));
        QCOMPARE(takeCalls(), QStringList());
    }

    void userIdList()
    {
        for (const uint uid : { 10030u, 65534u, 10200u, 99999u })
            QVERIFY(writeRecord(uid, QStringLiteral("@user") + QString::number(uid)));
        QVERIFY(m_root.writeFile(QStringLiteral("/var/lib/libkest-iam/10001.bak"), "not a record"));
        const QList<quint32> listing = listCacheUids();
        QCOMPARE(listing.size(), 6);
        QVERIFY(call(QStringLiteral("GetUserIdList")));
        QCOMPARE(qdbus_cast<QList<uint>>(m_result), QList<uint>(listing.cbegin(), listing.cend()));
        QVERIFY(m_root.writeSettings(kOff));
        QVERIFY(call(QStringLiteral("GetUserIdList")));
        QCOMPARE(qdbus_cast<QList<uint>>(m_result), QList<uint>());
    }

    void userGroups_data()
    {
        QTest::addColumn<QByteArray>("settings");
        QTest::addColumn<QString>("user");
        QTest::addColumn<QStringList>("groups");

        QTest::newRow("member of two") << kOn << QStringLiteral("@alice")
                                       << QStringList { QStringLiteral("kest"), QStringLiteral("lp") };
        QTest::newRow("member of none") << kOn << QStringLiteral("@nobody") << QStringList();
        QTest::newRow("switch off") << kOff << QStringLiteral("@alice") << QStringList();
    }

    void userGroups()
    {
        QFETCH(QByteArray, settings);
        QFETCH(QString, user);
        QFETCH(QStringList, groups);

        QVERIFY(m_root.writeSettings(settings));
        QVERIFY(call(QStringLiteral("GetUserGroups"), { user }));
        QCOMPARE(m_result.toStringList(), groups);
    }

    // The service object in this process, so that its messages can be read back.
    void messages_data()
    {
        QTest::addColumn<QByteArray>("settings"); // null: no settings file
        QTest::addColumn<QString>("actions"); // Enable writes, or "remove" (RemoveCacheFile of @bob)
        QTest::addColumn<QString>("refused");
        QTest::addColumn<QStringList>("calls"); // DeleteUser calls sorted
        QTest::addColumn<QStringList>("messages");
        QTest::addColumn<QList<uint>>("remaining");
        QTest::addColumn<QByteArray>("settingsAfter");

        const QStringList off { QStringLiteral("DeleteUser @alice true"), QStringLiteral("DeleteUser @bob true"),
            QStringLiteral("SwitchToUser {\"Type\":0,\"Uid\":0}") };
        const QList<uint> all { 1005, 10001, 10002 };
        const QString refusedDelete = QStringLiteral("delete user data failed. error: DeleteUser refused");
        const QString refusedKill = QStringLiteral("[ syncLightDM ] terminate session failed.  KillSession refused");

        QTest::newRow("off twice") << kOn << QStringLiteral("off off") << QString() << off
                                   << QStringList { QStringLiteral("already in destination status.") } << all << kOff;
        QTest::newRow("on") << kOff << QStringLiteral("on") << QString() << QStringList() << QStringList()
                            << QList<uint> { 1005 } << kOn;
        QTest::newRow("no settings file")
            << QByteArray() << QStringLiteral("off") << QString() << QStringList()
            << QStringList { QStringLiteral("critical error. cannot read configuration file ")
                   + m_root.filePath(kSettings) }
            << all << QByteArray();
        QTest::newRow("accounts daemon refuses") << kOn << QStringLiteral("off") << QStringLiteral("DeleteUser") << off
                                                 << QStringList { refusedDelete, refusedDelete } << all << kOff;
        QTest::newRow("lock service refuses")
            << kOn << QStringLiteral("off") << QStringLiteral("SwitchToUser") << off
            << QStringList { QStringLiteral("call ose-lockservice failed.") } << all << kOff;
        QTest::newRow("session list refused")
            << kOn << QStringLiteral("remove") << QStringLiteral("ListSessions") << sweep(QString())
            << QStringList { QStringLiteral("[ syncLightDM ] call systemd-logind.  ListSessions refused") }
            << QList<uint> { 1005, 10001 } << kOn;
        QTest::newRow("kills refused") << kOn << QStringLiteral("remove") << QStringLiteral("KillSession")
                                       << sweep(QStringLiteral("c2 c3 c4"))
                                       << QStringList { refusedKill, refusedKill, refusedKill }
                                       << QList<uint> { 1005, 10001 } << kOn;
    }

    void messages()
    {
        QFETCH(QByteArray, settings);
        QFETCH(QString, actions);
        QFETCH(QString, refused);
        QFETCH(QStringList, calls);
        QFETCH(QStringList, messages);
        QFETCH(QList<uint>, remaining);
        QFETCH(QByteArray, settingsAfter);

        DBusKestService service;
        QVERIFY(writeRecord(1005, QStringLiteral("localuser")));
        QVERIFY(settings.isNull() ? m_root.removeSettings() : m_root.writeSettings(settings));
        refusedMember = refused;
        SyslogCapture::clear();

        const QStringList steps = actions.split(QLatin1Char(' '));
        for (const QString &step : steps) {
            if (step == QLatin1String("remove"))
                QVERIFY(service.RemoveCacheFile(10002));
            else
                service.setProperty("Enable", step == QLatin1String("on"));
        }
        QStringList asked = takeCalls();
        std::sort(asked.begin(), asked.begin() + asked.filter(QStringLiteral("DeleteUser ")).size());
        QCOMPARE(asked, calls);
        QCOMPARE(logged(), messages);
        QCOMPARE(cachedUids(), remaining);
        QCOMPARE(m_root.readFile(kSettings), settingsAfter);
    }

    void passwordConfig_data()
    {
        QTest::addColumn<QByteArray>("settings");
        QTest::addColumn<QString>("expected");

        QTest::newRow("no keys") << kOn
                                 << QStringLiteral(
                                        "{\"first_login\":{\"enable\":false,\"update_password\":false},"
                                        "\"offline_login\":{\"cache_validity\":0,\"enable\":false},"
                                        "\"pw_history_check\":{\"enable\":false,\"history_num\":0},"
                                        "\"pw_strength\":{\"character_enable\":false,\"characters\":\"\","
                                        "\"contains_user\":false,\"lower\":false,\"max_length\":0,\"min_length\":0,"
                                        "\"number\":false,\"required\":0,\"special_enable\":false,"
                                        "\"special_string\":\"\",\"strength\":false,\"upper\":false},"
                                        "\"pw_validity\":{\"effective_time\":0,\"enable\":false,\"tip_time\":0}}");
        QTest::newRow("every key") << QByteArray(
            "[pw_strength]\ncharacter_enable=true\ncharacters=abcXYZ\ncontains_user=true\nlower=true\n"
            "max_length=20\nmin_length=8\nnumber=true\nrequired=3\nspecial_enable=true\n"
            "special_string=\"!@#$%^&*\"\nstrength=2\nupper=false\n"
            "[pw_validity]\nenable=true\neffective_time=90\ntip_time=7\n"
            "[pw_history_check]\nenable=true\nhistory_num=5\n"
            "[first_login]\nenable=true\nupdate_password=true\n"
            "[offline_login]\nenable=true\ncache_validity=30\n")
                                   << QStringLiteral(
                                          "{\"first_login\":{\"enable\":true,\"update_password\":true},"
                                          "\"offline_login\":{\"cache_validity\":30,\"enable\":true},"
                                          "\"pw_history_check\":{\"enable\":true,\"history_num\":5},"
                                          "\"pw_strength\":{\"character_enable\":true,\"characters\":\"abcXYZ\","
                                          "\"contains_user\":true,\"lower\":true,\"max_length\":20,\"min_length\":8,"
                                          "\"number\":true,\"required\":3,\"special_enable\":true,"
                                          "\"special_string\":\"!@#$%^&*\",\"strength\":true,\"upper\":false},"
                                          "\"pw_validity\":{\"effective_time\":90,\"enable\":true,\"tip_time\":7}}");
    }

    void passwordConfig()
    {
        QFETCH(QByteArray, settings);
        QFETCH(QString, expected);

        QVERIFY(m_root.writeSettings(settings));
        QVERIFY(call(QStringLiteral("QueryPasswordConfig")));
        QCOMPARE(m_result.toString(), expected);
    }

    // Through the real cache-kest client, the cache daemon and the test domain server.
    void passwordChange()
    {
        const QVariantList change { QStringLiteral("@alice"), QStringLiteral("alice-password"), QStringLiteral("new") };
        QVERIFY(call(QStringLiteral("ModifyUserPassword"), change));
        QCOMPARE(m_result, QVariant(QString()));

        DomainServerFixture server;
        QVERIFY2(server.isValid() && server.start(), qPrintable(server.errorText()));
        QVERIFY(m_root.writeSettings(server.settingsIni(
            { { QStringLiteral("main/enable"), true }, { QStringLiteral("main/network-timeout"), 2 } })));
        CacheDaemonFixture daemon;
        QVERIFY2(daemon.start(), qPrintable(daemon.errorText()));
        const QByteArray passTrue("{\"pass\":true}");
        QCOMPARE(daemon.call(QStringLiteral("authenticatePassword"), { change[0].toString(), change[1].toString() }),
            passTrue);
        const QString program = m_programs.filePath(QStringLiteral("cache-kest"));
        QVERIFY(QFile::link(CacheDaemonFixture::programPath(), program));
        QVERIFY(server.clearRequests());

        const bool called = call(QStringLiteral("ModifyUserPassword"), change);
        QFile::remove(program);
        QVERIFY(called);
        QCOMPARE(
            QJsonDocument::fromJson(m_result.toString().toUtf8()).object().value(QLatin1String("code")).toInt(-1), 0);
        QStringList asked; // user, old and new password of each change the domain server received
        const QList<QJsonObject> requests = server.requests();
        for (const QJsonObject &request : requests) {
            const QJsonObject body
                = QJsonDocument::fromJson(request.value(QLatin1String("body")).toString().toUtf8()).object();
            if (request.value(QLatin1String("path")) == QLatin1String("/v3/client/reset_password"))
                asked << body.value(QLatin1String("username")).toString() + QLatin1Char(' ')
                        + body.value(QLatin1String("old_password")).toString() + QLatin1Char(' ')
                        + body.value(QLatin1String("password")).toString();
        }
        QCOMPARE(asked, QStringList { QStringLiteral("@alice alice-password new") });
        QCOMPARE(daemon.call(QStringLiteral("authenticatePassword"), { change[0].toString(), QStringLiteral("new") }),
            passTrue);
    }

    void policy_data()
    {
        QTest::addColumn<bool>("sudo");
        QTest::addColumn<QString>("method");
        QTest::addColumn<QStringList>("arguments");
        QTest::addColumn<bool>("allowed");

        const QString set = QStringLiteral("org.freedesktop.DBus.Properties.Set");
        QTest::newRow("lists uids") << false << kName + QStringLiteral(".GetUserIdList") << QStringList() << true;
        QTest::newRow("removes all") << false << kName + QStringLiteral(".RemoveAllCacheFiles") << QStringList()
                                     << false;
        QTest::newRow("writes Enable") << false << set
                                       << QStringList { kName, QStringLiteral("Enable"), QStringLiteral("<false>") }
                                       << false;
        QTest::newRow("sudo member writes Enable")
            << true << set << QStringList { kName, QStringLiteral("Enable"), QStringLiteral("<true>") } << true;
    }

    // gdbus, run as nobody, takes the argument types from the introspection that anyone may read.
    void policy()
    {
        QFETCH(bool, sudo);
        QFETCH(QString, method);
        QFETCH(QStringList, arguments);
        QFETCH(bool, allowed);
        const group *sudoGroup = getgrnam("sudo");
        if (sudo && !sudoGroup)
            QSKIP("this machine has no group sudo");

        const QStringList command = kNobody
            + QStringList { sudo ? QStringLiteral("--groups=") + QString::number(sudoGroup->gr_gid)
                                 : QStringLiteral("--clear-groups"),
                  QStringLiteral("gdbus"), QStringLiteral("call"), QStringLiteral("--system"), QStringLiteral("--dest"),
                  kName, QStringLiteral("--object-path"), kPath, QStringLiteral("--method"), method }
            + arguments;
        QProcess client;
        client.start(command.first(), command.mid(1));
        QVERIFY(client.waitForFinished(30000));
        QCOMPARE(client.exitCode() == 0, allowed);
        QCOMPARE(client.readAllStandardError().contains("org.freedesktop.DBus.Error.AccessDenied"), !allowed);
        QCOMPARE(cachedUids(), (QList<uint> { 10001, 10002 }));
        QCOMPARE(m_root.readFile(kSettings), kOn);
    }

    // Last: it ends the service.
    void lifecycle()
    {
        const QByteArray pid = QByteArray::number(m_main.processId());
        const QString pidFile = m_root.filePath(QStringLiteral("/run/dbus-kest.pid"));
        QTRY_COMPARE_WITH_TIMEOUT(m_root.readFile(QStringLiteral("/run/dbus-kest.pid")), pid, 15000);
        QCOMPARE(QFile::permissions(pidFile),
            QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ReadUser | QFileDevice::WriteUser
                | QFileDevice::ReadGroup | QFileDevice::ReadOther);

        QProcess second;
        start(second);
        QCOMPARE(exitCodeOf(second), 255);
        QProcess notRoot;
        start(notRoot, {}, kNobody + QStringList { QStringLiteral("--clear-groups") });
        QCOMPARE(exitCodeOf(notRoot), 2);
        QCOMPARE(m_conn.interface()->servicePid(kName).value(), uint(m_main.processId()));
        QCOMPARE(m_root.readFile(QStringLiteral("/run/dbus-kest.pid")), pid);

        m_main.terminate();
        QCOMPARE(exitCodeOf(m_main), 15);
        QCOMPARE(m_root.readFile(QStringLiteral("/run/dbus-kest.pid")), pid);
        QCOMPARE(QDir(m_guard.path()).entryList({ QStringLiteral("qipc_*") }, QDir::Files), QStringList());
        // Started before the service and running all along, the idle one took neither the guard nor the name.
        QCOMPARE(m_idle.state(), QProcess::Running);
        QVERIFY(!m_conn.interface()->isServiceRegistered(kName).value());
    }

private:
    // The guard's key file goes to TMPDIR; cache-kest is looked for in m_programs only.
    void start(QProcess &process, const QStringList &arguments = {}, const QStringList &wrapper = {})
    {
        QProcessEnvironment environment = QProcessEnvironment::systemEnvironment();
        environment.insert(QStringLiteral("TMPDIR"), m_guard.path());
        environment.insert(QStringLiteral("PATH"), m_programs.path());
        process.setProcessEnvironment(environment);
        process.setProcessChannelMode(QProcess::ForwardedChannels);
        const QStringList command = wrapper
            + QStringList { qEnvironmentVariable("KEST_TEST_BINARY_DIR")
                  + QStringLiteral("/src/dbus-service/dbus-kest") }
            + arguments;
        process.start(command.first(), command.mid(1));
        QVERIFY(process.waitForStarted());
    }

    static int exitCodeOf(QProcess &process)
    {
        process.waitForFinished(15000);
        return process.exitStatus() == QProcess::NormalExit ? process.exitCode() : -1;
    }

    bool call(const QString &member, const QVariantList &arguments = {})
    {
        QDBusMessage message = QDBusMessage::createMethodCall(kName, kPath, kName, member);
        message.setArguments(arguments);
        const QDBusMessage reply = m_conn.call(message);
        m_result = reply.arguments().value(0);
        return reply.type() == QDBusMessage::ReplyMessage;
    }

    QVariant userProperty(uint uid, const QString &property)
    {
        QDBusMessage get = QDBusMessage::createMethodCall(kName, kPath + QStringLiteral("/user") + QString::number(uid),
            QStringLiteral("org.freedesktop.DBus.Properties"), QStringLiteral("Get"));
        get << kName + QStringLiteral(".user") << property;
        const QDBusMessage reply = m_conn.call(get);
        return reply.type() == QDBusMessage::ReplyMessage ? reply.arguments().value(0).value<QDBusVariant>().variant()
                                                          : QVariant();
    }

    // Sent on the connection of the next call, the signal reaches the service before that call does.
    void announce(const char *session)
    {
        QDBusMessage signal = QDBusMessage::createSignal(
            kLogind, QStringLiteral("org.freedesktop.login1.Manager"), QStringLiteral("SessionNew"));
        signal << QLatin1String(session)
               << QDBusObjectPath(kLogind + QStringLiteral("/session/") + QLatin1String(session));
        QVERIFY(m_conn.send(signal));
        QVERIFY(call(QStringLiteral("GetUserIdList")));
    }

    PrivateBus m_bus { PrivateBus::Policy::System, { QStringLiteral(KEST_POLICY_FILE) } };
    TestRoot m_root;
    QTemporaryDir m_guard;
    QTemporaryDir m_programs;
    QDBusConnection m_conn { QString() };
    Peers m_peers;
    QThread m_thread;
    QProcess m_main;
    QProcess m_idle;
    QVariant m_result;
};

QTEST_GUILESS_MAIN(DBusKestTest)
#include "test_dbuskest.moc"
