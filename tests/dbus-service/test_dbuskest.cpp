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
#include <QDBusInterface>
#include <QDBusVariant>
#include <QDBusVirtualObject>
#include <QDir>
#include <QJsonDocument>
#include <QJsonObject>
#include <QMutex>
#include <QProcess>
#include <QRegularExpression>
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
const QString kPidFile = QStringLiteral("/run/dbus-kest.pid");
const QByteArray kOn("[main]\nenable=true\n");
const QByteArray kOff("[main]\nenable=false\n");
const QString kNobody = QStringLiteral("--reuid=65534 --regid=65534 "); // options of setpriv

// What the stand-ins were asked, in order, and the members told to refuse; they answer on a thread of their own.
QMutex peersLock;
QStringList peerCalls;
QString refusedMembers; // separated by spaces

QStringList takeCalls()
{
    QMutexLocker locker(&peersLock);
    return std::exchange(peerCalls, QStringList());
}

bool writeRecord(uint uid, const QString &name, uint removeStatus = 0)
{
    const QString json = QStringLiteral(R"({"version": 16777216, "uid": %1, "main_gid": %2, "account": "%3",
        "password": "digest-of-%3", "home_path": "/home/remote/%3", "login_shell": "/bin/zsh",
        "gecos": "Full Name of %3", "remove_status": %4})");
    CacheControlPtr record;
    return cacheRecordFromJson(
               record, json.arg(QString::number(uid), QString::number(uid + 100), name, QString::number(removeStatus)))
        && saveCacheRecord(*record);
}

QList<uint> cachedUids()
{
    QList<uint> uids = listCacheUids();
    std::sort(uids.begin(), uids.end());
    return uids;
}

// One line per member, argument and annotation of the interface, in document order.
QStringList members(const QByteArray &xml, const QString &interface)
{
    QXmlStreamReader reader(xml);
    QStringList lines;
    bool inside = false;
    while (!reader.atEnd()) {
        reader.readNext();
        const QXmlStreamAttributes attributes = reader.attributes();
        if (reader.name() == QLatin1String("interface")) {
            inside = reader.isStartElement() && attributes.value(QLatin1String("name")) == interface;
        } else if (inside && reader.isStartElement()) {
            QString line = reader.name().toString();
            for (const char *key : { "name", "type", "direction", "access", "value" })
                line += QLatin1Char(' ') + attributes.value(QLatin1String(key));
            lines.append(line.trimmed());
        }
    }
    return lines;
}
} // namespace

// logind, the accounts daemon and the lock service: each call is recorded ("KillSession c2 all 9") and answered.
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
        const QStringList users { QStringLiteral("@alice"), QStringLiteral("@bob"), QStringLiteral("lightdm"),
            QStringLiteral("localuser") }; // of sessions c1 to c4: c3 is the greeter's, c4 a local user's
        if (member == QLatin1String("Get")) // of a session's Name
            return connection.send(message.createReply(
                QVariant::fromValue(QDBusVariant(users.value(message.path().right(1).toInt() - 1)))));
        if (member == QLatin1String("Introspect"))
            return false;
        QStringList call { member };
        for (const QVariant &argument : message.arguments())
            call.append(argument.toString());
        QMutexLocker locker(&peersLock);
        peerCalls.append(call.join(QLatin1Char(' ')));
        if (refusedMembers.split(QLatin1Char(' ')).contains(member))
            return connection.send(message.createErrorReply(QDBusError::Failed, member + QStringLiteral(" refused")));
        SessionList sessions;
        const uint uids[] { 10001, 10002, 113, 1000 };
        for (int i = 0; i < 4; ++i) {
            const QString id = QStringLiteral("c") + QString::number(i + 1);
            sessions.append({ id, uids[i], users[i], QStringLiteral("seat0"),
                QDBusObjectPath(kLogind + QStringLiteral("/session/") + id) });
        }
        return connection.send(member == QLatin1String("ListSessions")
                ? message.createReply(QVariant::fromValue(sessions))
                : message.createReply());
    }
};

// One dbus-kest process on a private system bus serves every check; those that need its log run the service here.
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

        init();
        QVERIFY(m_root.writeFile(kPidFile, "99999\n"));
        start(m_idle, { QStringLiteral("idle") });
        start(m_main);
        QTRY_COMPARE_WITH_TIMEOUT(m_conn.interface()->servicePid(kName).value(), uint(m_main.processId()), 15000);
        QVERIFY(!QFile::exists(m_root.filePath(kPidFile)));
        qInstallMessageHandler(messageHandler);
    }

    void cleanupTestCase()
    {
        m_idle.terminate();
        m_idle.waitForFinished();
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
        takeCalls();
        refusedMembers.clear();
    }

    void introspection()
    {
        for (const QString &interface : { kName, kName + QStringLiteral(".user") }) {
            QFile file(QStringLiteral(KEST_INTERFACES_DIR "/") + interface + QStringLiteral(".xml"));
            QVERIFY(file.open(QIODevice::ReadOnly));
            const QStringList recorded = members(file.readAll(), interface);
            QVERIFY(!recorded.isEmpty());
            QProcess gdbus;
            gdbus.start(QStringLiteral("gdbus"),
                { QStringLiteral("introspect"), QStringLiteral("--system"), QStringLiteral("--dest"), kName,
                    QStringLiteral("--object-path"), interface == kName ? kPath : kPath + QStringLiteral("/user10002"),
                    QStringLiteral("--xml") });
            QVERIFY(gdbus.waitForFinished(30000) && gdbus.exitCode() == 0);
            QCOMPARE(members(gdbus.readAllStandardOutput(), interface), recorded);
        }
    }

    void userObjects()
    {
        const auto entry = [this](uint uid) {
            QStringList read;
            for (const char *property : { "Uid", "Gid", "UserName", "Password", "HomeDir", "Shell", "Gecos" })
                read.append(userProperty(uid, property).toString());
            return read.join(QLatin1Char('|'));
        };
        const QString bob
            = QStringLiteral("10002|10102|@bob|digest-of-@bob|/home/remote/@bob|/bin/zsh|Full Name of @bob");
        QCOMPARE(entry(10002), bob);
        // A record marked for removal has no user list entry: its object reads as zero and empty text.
        QVERIFY(writeRecord(10003, QStringLiteral("@carol"), 1));
        announce("c3");
        QVERIFY(!userProperty(10003, "Uid").isValid());
        announce("c4");
        QCOMPARE(entry(10003), QStringLiteral("0|0|||||"));
        QCOMPARE(entry(10002), bob);
        QCOMPARE(entry(10001).section(QLatin1Char('|'), 0, 2), QStringLiteral("10001|10101|@alice"));
        QVERIFY(m_root.writeSettings(kOff));
        announce("c1");
        for (const uint uid : { 10001u, 10002u, 10003u })
            QVERIFY(!userProperty(uid, "Uid").isValid());
    }

    // A call and what it left: reply, records, the stand-ins' calls, 10002's remove status (~0: none) and object.
    void methods_data()
    {
        QTest::addColumn<QString>("method");
        QTest::addColumn<QVariantList>("arguments");
        QTest::addColumn<bool>("enabled");
        QTest::addColumn<QVariant>("reply");
        QTest::addColumn<QList<uint>>("remaining");
        QTest::addColumn<QStringList>("calls");
        QTest::addColumn<quint32>("status");
        const auto row = [](const QByteArray &name, const QVariantList &arguments, bool enabled, const QVariant &reply,
                             const QList<uint> &remaining, const char *killed, quint32 status) {
            QStringList calls { QStringLiteral("ListSessions") };
            for (const QString &id : QString::fromLatin1(killed).split(QLatin1Char(' '), Qt::SkipEmptyParts))
                calls.append(QStringLiteral("KillSession ") + id + QStringLiteral(" all 9"));
            QTest::newRow(name.constData()) << QString::fromLatin1(name.left(name.indexOf(','))) << arguments << enabled
                                            << reply << remaining << (killed ? calls : QStringList()) << status;
        };
        const QList<uint> all { 10001, 10002, 10003 };
        for (const bool on : { true, false }) {
            const QByteArray state = on ? ", on" : ", off";
            const char *const sweep = on ? "c2 c3 c4" : nullptr; // the sessions of users without a record
            row("RemoveCacheFile" + state, { 10002u }, on, true, { 10001, 10003 }, sweep, ~0u);
            row("RemoveCacheFilesNotInList" + state, { QVariant::fromValue(QList<uint> { 10001 }) }, on, true,
                { 10001 }, sweep, ~0u);
            row("RemoveAllCacheFiles" + state, {}, on, true, {}, on ? "c1 c2 c3 c4" : nullptr, ~0u);
            row("DisableTerminal" + state, { 10002u }, on, on, all, nullptr, on ? 1 : 0);
            row("GetUserGroups" + state, { QStringLiteral("@alice") }, on,
                on ? QStringList { QStringLiteral("kest"), QStringLiteral("lp") } : QStringList(), all, nullptr, 0);
        }
        row("DisableTerminal, no record", { 20000u }, true, true, all, nullptr, 0);
    }

    void methods()
    {
        QFETCH(QString, method);
        QFETCH(QVariantList, arguments);
        QFETCH(bool, enabled);
        QFETCH(QVariant, reply);
        QFETCH(QList<uint>, remaining);
        QFETCH(QStringList, calls);
        QFETCH(quint32, status);

        QVERIFY(writeRecord(10003, QStringLiteral("@carol")));
        announce("c1");
        QVERIFY(m_root.writeSettings(enabled ? kOn : kOff));
        takeCalls();
        QCOMPARE(call(method, arguments), reply);
        QCOMPARE(cachedUids(), remaining);
        QCOMPARE(takeCalls(), calls);
        CacheControlPtr record = createCacheControl();
        record->setUid(10002);
        QCOMPARE(loadCacheRecord(record) && record ? record->removeStatus() : ~0u, status);
        QCOMPARE(userProperty(10002, "Uid").isValid(), method != QLatin1String("RemoveAllCacheFiles"));
    }

    // The service object in this process, so that its messages can be read back.
    void messages_data()
    {
        QTest::addColumn<QString>("actions"); // Enable writes, "remove" (RemoveCacheFile of @bob), "unset" (settings)
        QTest::addColumn<QString>("refused");
        QTest::addColumn<QStringList>("trace"); // the stand-ins' calls (DeleteUser sorted), then the warnings
        QTest::addColumn<QList<uint>>("remaining");
        QTest::addColumn<QByteArray>("settings"); // afterwards
        const auto row = [](const char *name, const char *actions, const char *refused, const QByteArray &trace,
                             const QList<uint> &remaining, const QByteArray &settings) {
            QTest::newRow(name) << QString::fromLatin1(actions) << QString::fromLatin1(refused)
                                << QString::fromUtf8(trace).split(QLatin1Char('\n')) << remaining << settings;
        };
        const QByteArray off("DeleteUser @alice true\nDeleteUser @bob true\nSwitchToUser {\"Type\":0,\"Uid\":0}\n");
        const QByteArray deleteRefused("delete user data failed. error: DeleteUser refused\n");
        const QByteArray killRefused("\n[ syncLightDM ] terminate session failed.  KillSession refused");
        const QList<uint> all { 1005, 10001, 10002 };
        row("off twice, on", "off off on", "", off + "already in destination status.", { 1005 }, kOn);
        row("no settings file", "unset off", "",
            "critical error. cannot read configuration file " + m_root.filePath(kSettings).toUtf8(), all, QByteArray());
        row("accounts daemon and lock service refuse", "off", "DeleteUser SwitchToUser",
            off + deleteRefused.repeated(2) + "call ose-lockservice failed.", all, kOff);
        row("session list refused", "remove", "ListSessions",
            "ListSessions\n[ syncLightDM ] call systemd-logind.  ListSessions refused", { 1005, 10001 }, kOn);
        row("kills refused", "remove", "KillSession",
            "ListSessions\nKillSession c2 all 9\nKillSession c3 all 9\nKillSession c4 all 9" + killRefused.repeated(3),
            { 1005, 10001 }, kOn);
    }

    void messages()
    {
        QFETCH(QString, actions);
        QFETCH(QString, refused);
        QFETCH(QStringList, trace);
        QFETCH(QList<uint>, remaining);
        QFETCH(QByteArray, settings);

        DBusKestService service;
        QVERIFY(writeRecord(1005, QStringLiteral("localuser")));
        refusedMembers = refused;
        SyslogCapture::clear();
        for (const QString &step : actions.split(QLatin1Char(' '))) {
            if (step == QLatin1String("remove"))
                QVERIFY(service.RemoveCacheFile(10002));
            else if (step == QLatin1String("unset"))
                QVERIFY(m_root.removeSettings());
            else
                service.setProperty("Enable", step == QLatin1String("on"));
        }
        QStringList asked = takeCalls();
        std::sort(asked.begin(), asked.begin() + asked.filter(QStringLiteral("DeleteUser ")).size());
        for (const SyslogLine &line : SyslogCapture::lines()) // warnings and critical messages, without "cpu time: N, "
            if (line.priority == LOG_WARNING || line.priority == LOG_CRIT)
                asked.append(QString::fromUtf8(line.text.mid(line.text.indexOf(", ") + 2)));
        QCOMPARE(asked, trace);
        QCOMPARE(cachedUids(), remaining);
        QCOMPARE(m_root.readFile(kSettings), settings);
    }

    // With no keys every value falls back to false, 0 or "".
    void passwordConfig()
    {
        const QString every = QString::fromLatin1(
            R"({"first_login":{"enable":true,"update_password":true},"offline_login":{"cache_validity":30,)"
            R"("enable":true},"pw_history_check":{"enable":true,"history_num":5},"pw_strength":{"character_enable":)"
            R"(true,"characters":"abcXYZ","contains_user":true,"lower":true,"max_length":20,"min_length":8,)"
            R"("number":true,"required":3,"special_enable":true,"special_string":")"
            "!@#$%^&*"
            R"(","strength":true,"upper":false},"pw_validity":{"effective_time":90,"enable":true,"tip_time":7}})");
        QString none = every;
        none.replace(QStringLiteral("true"), QStringLiteral("false"))
            .replace(QRegularExpression(QStringLiteral(":\\d+")), QStringLiteral(":0"))
            .replace(QRegularExpression(QStringLiteral(":\"[^\"]*\"")), QStringLiteral(":\"\""));
        const QString query = QStringLiteral("QueryPasswordConfig");
        QCOMPARE(call(query).toString(), none);
        QVERIFY(m_root.writeSettings(
            "[pw_strength]\ncharacter_enable=true\ncharacters=abcXYZ\ncontains_user=true\nlower=true\nmax_length=20\n"
            "min_length=8\nnumber=true\nrequired=3\nspecial_enable=true\nspecial_string=\"!@#$%^&*\"\nstrength=2\n"
            "upper=false\n[pw_validity]\nenable=true\neffective_time=90\ntip_time=7\n[pw_history_check]\nenable=true\n"
            "history_num=5\n[first_login]\nenable=true\nupdate_password=true\n[offline_login]\nenable=true\n"
            "cache_validity=30\n"));
        QCOMPARE(call(query).toString(), every);
    }

    // Through the real cache-kest client, the cache daemon and the test domain server.
    void passwordChange()
    {
        const QVariantList change { QStringLiteral("@alice"), QStringLiteral("alice-password"), QStringLiteral("new") };
        QCOMPARE(call(QStringLiteral("ModifyUserPassword"), change), QVariant(QString()));

        DomainServerFixture server;
        QVERIFY2(server.isValid() && server.start(), qPrintable(server.errorText()));
        QVERIFY(m_root.writeSettings(server.settingsIni(
            { { QStringLiteral("main/enable"), true }, { QStringLiteral("main/network-timeout"), 2 } })));
        CacheDaemonFixture daemon;
        QVERIFY2(daemon.start(), qPrintable(daemon.errorText()));
        const auto accepts = [&daemon](const char *password) {
            return daemon.call(
                QStringLiteral("authenticatePassword"), { QStringLiteral("@alice"), QLatin1String(password) });
        };
        QCOMPARE(accepts("alice-password"), QByteArray("{\"pass\":true}"));
        // The real client behind a wrapper that notes the command line, which every local user could read.
        const QString program = m_programs.filePath(QStringLiteral("cache-kest"));
        const QString noted = m_programs.filePath(QStringLiteral("arguments"));
        QFile wrapper(program);
        QVERIFY(wrapper.open(QIODevice::WriteOnly));
        wrapper.write("#!/bin/sh\necho \"$*\" >" + noted.toUtf8() + "\nexec "
            + CacheDaemonFixture::programPath().toUtf8() + " \"$@\"\n");
        wrapper.close();
        QVERIFY(wrapper.setPermissions(QFile::ReadOwner | QFile::ExeOwner));
        const QVariant reply = call(QStringLiteral("ModifyUserPassword"), change);
        QFile::remove(program);
        QFile arguments(noted);
        QVERIFY(arguments.open(QIODevice::ReadOnly));
        QCOMPARE(arguments.readAll(), QByteArray("--modify-user-passwd -\n"));
        // The domain server checks the old password; the new one must be the one accepted afterwards.
        QCOMPARE(QJsonDocument::fromJson(reply.toString().toUtf8()).object().value(QLatin1String("code")).toInt(-1), 0);
        QCOMPARE(accepts("new"), QByteArray("{\"pass\":true}"));
    }

    // gdbus run as nobody: what the bus policy lets through, and what the per-user objects show. Only root
    // (userObjects) and the account itself see the stored digest; the bus takes only callers it can find
    // groups for, so the account is one that exists here: nobody, cached as a domain account.
    void policy_data()
    {
        QTest::addColumn<QString>("groups"); // of nobody; empty: there is no group sudo
        QTest::addColumn<QString>("path");
        QTest::addColumn<QString>("method"); // and its arguments
        QTest::addColumn<bool>("allowed");
        QTest::addColumn<QByteArray>("output"); // null: not looked at
        const QString none = QStringLiteral("--clear-groups");
        const QString set = QStringLiteral("org.freedesktop.DBus.Properties.Set ") + kName + QStringLiteral(" Enable ");
        const QString password
            = QStringLiteral("org.freedesktop.DBus.Properties.Get ") + kName + QStringLiteral(".user Password");
        const group *sudo = getgrnam("sudo");
        const auto row = [&](const char *name, const QString &groups, const QString &path, const QString &method,
                             bool allowed, const QByteArray &output) {
            QTest::newRow(name) << groups << kPath + path << method << allowed << output;
        };
        row("lists uids", none, QString(), kName + QStringLiteral(".GetUserIdList"), true, QByteArray());
        row("removes all", none, QString(), kName + QStringLiteral(".RemoveAllCacheFiles"), false, QByteArray());
        row("writes Enable", none, QString(), set + QStringLiteral("<false>"), false, QByteArray());
        row("sudo member writes Enable", sudo ? QStringLiteral("--groups=") + QString::number(sudo->gr_gid) : QString(),
            QString(), set + QStringLiteral("<true>"), true, QByteArray());
        row("another account's Password", none, QStringLiteral("/user10002"), password, true, "(<'x'>,)");
        row("its own Password", none, QStringLiteral("/user65534"), password, true, "(<'digest-of-@nobody'>,)");
    }

    void policy()
    {
        QFETCH(QString, groups);
        QFETCH(QString, path);
        QFETCH(QString, method);
        QFETCH(bool, allowed);
        QFETCH(QByteArray, output);
        if (groups.isEmpty())
            QSKIP("this machine has no group sudo");
        QVERIFY(writeRecord(65534, QStringLiteral("@nobody")));
        announce("c4");
        QProcess client;
        client.start(QStringLiteral("setpriv"),
            (kNobody + groups + QStringLiteral(" gdbus call --system --dest ") + kName
                + QStringLiteral(" --object-path ") + path + QStringLiteral(" --method ") + method)
                .split(QLatin1Char(' ')));
        QVERIFY(client.waitForFinished(30000));
        QCOMPARE(client.exitCode() == 0, allowed);
        QCOMPARE(client.readAllStandardError().contains("org.freedesktop.DBus.Error.AccessDenied"), !allowed);
        if (!output.isNull())
            QCOMPARE(client.readAllStandardOutput().trimmed(), output);
    }

    // Last: it ends the service.
    void lifecycle()
    {
        const auto exitCodeOf = [](QProcess &process) {
            process.waitForFinished(15000);
            return process.exitStatus() == QProcess::NormalExit ? process.exitCode() : -1;
        };
        const QByteArray pid = QByteArray::number(m_main.processId());
        QTRY_COMPARE_WITH_TIMEOUT(m_root.readFile(kPidFile), pid, 15000);
        QCOMPARE(QFile::permissions(m_root.filePath(kPidFile)), QFile::Permissions(0x6644)); // rw-r--r--

        QProcess second;
        start(second);
        QCOMPARE(exitCodeOf(second), 255);
        QProcess notRoot;
        start(notRoot, {},
            (QStringLiteral("setpriv ") + kNobody + QStringLiteral("--clear-groups")).split(QLatin1Char(' ')));
        QCOMPARE(exitCodeOf(notRoot), 2);
        QCOMPARE(m_conn.interface()->servicePid(kName).value(), uint(m_main.processId()));
        QCOMPARE(m_root.readFile(kPidFile), pid);

        m_main.terminate();
        QCOMPARE(exitCodeOf(m_main), 15);
        QCOMPARE(m_root.readFile(kPidFile), pid);
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

    // The first reply argument; an error reply fails the running test.
    QVariant call(const QString &member, const QVariantList &arguments = {})
    {
        QDBusMessage message = QDBusMessage::createMethodCall(kName, kPath, kName, member);
        message.setArguments(arguments);
        const QDBusMessage reply = m_conn.call(message);
        QTest::qVerify(
            reply.type() == QDBusMessage::ReplyMessage, "reply", qPrintable(reply.errorMessage()), __FILE__, __LINE__);
        return reply.arguments().value(0);
    }

    QVariant userProperty(uint uid, const char *property)
    {
        return QDBusInterface(
            kName, kPath + QStringLiteral("/user") + QString::number(uid), kName + QStringLiteral(".user"), m_conn)
            .property(property);
    }

    // Sent on the connection of the next call, the signal reaches the service before that call does.
    void announce(const char *session)
    {
        const QDBusObjectPath path(kLogind + QStringLiteral("/session/") + QLatin1String(session));
        QVERIFY(m_conn.send(QDBusMessage::createSignal(
                                kLogind, QStringLiteral("org.freedesktop.login1.Manager"), QStringLiteral("SessionNew"))
            << QLatin1String(session) << QVariant::fromValue(path)));
        call(QStringLiteral("GetUserIdList"));
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
};

QTEST_GUILESS_MAIN(DBusKestTest)
#include "test_dbuskest.moc"
