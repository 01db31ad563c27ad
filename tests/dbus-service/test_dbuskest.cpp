#include "cachecontrolfactory.h"
#include "cachestore.h"
#include "dbuskestservice.h"
#include "messagehandler.h"
#include "privatebus.h"
#include "testroot.h"

#include <QDBusConnectionInterface>
#include <QDBusVariant>
#include <QDBusVirtualObject>
#include <QDir>
#include <QMutex>
#include <QProcess>
#include <QRegularExpression>
#include <QTest>
#include <QThread>

#include <algorithm>
#include <grp.h>

namespace
{
const QString kName = QStringLiteral("com.nimbal.kest.iam");
const QString kPath = QStringLiteral("/com/nimbal/kest/iam");
const QString kLogind = QStringLiteral("/org/freedesktop/login1");
const QString kSettings = QStringLiteral("/etc/kest-iam.conf");
const QString kPidFile = QStringLiteral("/run/dbus-kest.pid");
const QByteArray kOn("[main]\nenable=true\n");
const QByteArray kOff("[main]\nenable=false\n");
const QByteArray kNobody("--reuid=65534 --regid=65534"); // options of setpriv

// What the stand-ins were asked, in order, and the members told to refuse; they answer on a thread of their own.
QMutex peersLock;
QStringList peerCalls;
QString refusedMembers; // separated by spaces

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

// The arguments of logind's SessionNew.
QVariantList sessionNew(const char *session)
{
    return { QLatin1String(session),
        QVariant::fromValue(QDBusObjectPath(kLogind + QStringLiteral("/session/") + QLatin1String(session))) };
}
} // namespace

// logind, the accounts daemon and the lock service: each call is recorded ("KillSession c2 all 9") and answered.
class Peers : public QDBusVirtualObject
{
public:
    QString introspect(const QString &) const override // logind's signal, on every path
    {
        return QStringLiteral("<interface name=\"org.freedesktop.login1.Manager\"><signal name=\"SessionNew\">"
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
        if (member != QLatin1String("ListSessions"))
            return connection.send(message.createReply());
        SessionList sessions;
        for (const uint uid : { 10001, 10002, 113, 1000 }) {
            const QString id = QStringLiteral("c") + QString::number(sessions.size() + 1);
            sessions.append({ id, uid, users[sessions.size()], QStringLiteral("seat0"),
                QDBusObjectPath(kLogind + QStringLiteral("/session/") + id) });
        }
        return connection.send(message.createReply(QVariant::fromValue(sessions)));
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
        const QMutexLocker locker(&peersLock);
        peerCalls.clear();
        refusedMembers.clear();
    }

    // The running service publishes what data/interfaces records, to the character. The per-user object is
    // 10003's, whose record is marked for removal: without a user list entry it still answers.
    void introspection()
    {
        QVERIFY(writeRecord(10003, QStringLiteral("@carol"), 1));
        announce("c4");
        for (const QString &interface : { kName, kName + QStringLiteral(".user") }) {
            const QRegularExpression block(QStringLiteral("<interface name=\"") + QRegularExpression::escape(interface)
                    + QStringLiteral("\">.*?</interface>"),
                QRegularExpression::DotMatchesEverythingOption);
            QFile file(QStringLiteral(KEST_INTERFACES_DIR "/") + interface + QStringLiteral(".xml"));
            QVERIFY(file.open(QIODevice::ReadOnly));
            const QString recorded = block.match(QString::fromUtf8(file.readAll())).captured();
            QVERIFY(!recorded.isEmpty());
            const QDBusMessage introspect = QDBusMessage::createMethodCall(kName,
                interface == kName ? kPath : kPath + QStringLiteral("/user10003"),
                QStringLiteral("org.freedesktop.DBus.Introspectable"), QStringLiteral("Introspect"));
            QCOMPARE(block.match(m_conn.call(introspect).arguments().value(0).toString()).captured(), recorded);
        }
    }

    // The service object in this process, so that its cache and objects can be looked at. A row's name starts with
    // its steps: Enable written ("on", "off"), the settings disabled or removed ("disabled", "unset"), or a method
    // called with the row's arguments through this connection, which answers it itself; after "refused" come the
    // members the stand-ins refuse.
    void service_data()
    {
        QTest::addColumn<QVariantList>("arguments");
        QTest::addColumn<QVariant>("reply");
        // The stand-ins' calls (DeleteUser sorted), then "cached uids | 10002's remove status | its object | Enable".
        QTest::addColumn<QStringList>("outcome");
        const auto row = [](const QByteArray &name, const QVariantList &arguments, const QVariant &reply,
                             const QByteArray &calls, const QByteArray &state) {
            QTest::newRow(name.constData())
                << arguments << reply
                << (QString::fromUtf8(calls).split(QLatin1Char('\n'), Qt::SkipEmptyParts) << QString::fromUtf8(state));
        };
        const QByteArray enabled = " | " + kOn.simplified(), disabled = " | " + kOff.simplified();
        const QByteArray all("1005 10001 10002 | 0 | object"), left("1005 10001 | none | object");
        // Once the cache is changed, the sessions of users without a record end.
        const QByteArray sweep("ListSessions\nKillSession c2 all 9\nKillSession c3 all 9\nKillSession c4 all 9");
        for (const bool on : { true, false }) {
            const QByteArray state = on ? "" : "disabled ", calls = on ? sweep : "", enable = on ? enabled : disabled;
            row(state + "RemoveCacheFile", { 10002u }, true, calls, left + enable);
            row(state + "RemoveCacheFilesNotInList", { QVariant::fromValue(QList<uint> { 10001 }) }, true, calls,
                "10001 | none | object" + enable);
            row(state + "RemoveAllCacheFiles", {}, true,
                on ? QByteArray(sweep).replace("\nKillSession c2", "\nKillSession c1 all 9\nKillSession c2") : "",
                "| none | no object" + enable);
            row(state + "DisableTerminal", { 10002u }, on, "", (on ? "1005 10001 10002 | 1 | object" : all) + enable);
            row(state + "GetUserGroups", { QStringLiteral("@alice") },
                on ? QStringList { QStringLiteral("kest"), QStringLiteral("lp") } : QStringList(), "", all + enable);
        }
        row("DisableTerminal, no record", { 20000u }, true, "", all + enabled);
        row("RemoveCacheFile, refused ListSessions", { 10002u }, true, "ListSessions", left + enabled);
        row("RemoveCacheFile, refused KillSession", { 10002u }, true, sweep, left + enabled);
        const QByteArray off("DeleteUser @alice true\nDeleteUser @bob true\nSwitchToUser {\"Type\":0,\"Uid\":0}");
        row("off off on", {}, QVariant(), off, "1005 | none | object" + enabled); // the second "off" does nothing
        row("unset off", {}, QVariant(), "", all + " | ");
        row("off, refused DeleteUser SwitchToUser", {}, QVariant(), off, all + disabled);
        // A new session rebuilds the per-user objects (none while disabled), unless it is the greeter's.
        row("disabled SessionNew, a user's", sessionNew("c1"), QVariant(), "",
            "1005 10001 10002 | 0 | no object" + disabled);
        row("disabled SessionNew, the greeter's", sessionNew("c3"), QVariant(), "", all + disabled);
    }

    void service()
    {
        QFETCH(QVariantList, arguments);
        QVERIFY(writeRecord(1005, QStringLiteral("localuser")));
        QDBusConnection bus = QDBusConnection::systemBus();
        DBusKestService service;
        QVERIFY(bus.registerObject(kPath, &service, QDBusConnection::ExportAllContents));
        QVERIFY(service.registerUserObjects(bus));
        const QString tag = QString::fromLatin1(QTest::currentDataTag());
        refusedMembers = tag.section(QStringLiteral("refused "), 1);
        QVariant last;
        for (const QString &step : tag.section(QLatin1Char(','), 0, 0).split(QLatin1Char(' '))) {
            if (step == QLatin1String("on") || step == QLatin1String("off")) {
                service.setProperty("Enable", step == QLatin1String("on"));
            } else if (step == QLatin1String("disabled") || step == QLatin1String("unset")) {
                QVERIFY(step == QLatin1String("unset") ? m_root.removeSettings() : m_root.writeSettings(kOff));
            } else {
                QDBusMessage message = QDBusMessage::createMethodCall(bus.baseService(), kPath, kName, step);
                message.setArguments(arguments);
                last = bus.call(message).arguments().value(0);
            }
        }
        QTEST(last, "reply");
        QStringList outcome;
        std::swap(outcome, (QMutexLocker(&peersLock), peerCalls));
        std::sort(outcome.begin(), outcome.begin() + outcome.filter(QStringLiteral("DeleteUser ")).size());
        QList<uint> uids = listCacheUids();
        std::sort(uids.begin(), uids.end());
        QByteArray state;
        for (const uint uid : uids)
            state += QByteArray::number(uid) + ' ';
        CacheControlPtr record = createCacheControl();
        record->setUid(10002);
        state += "| " + (loadCacheRecord(record) && record ? QByteArray::number(record->removeStatus()) : "none")
            + (bus.objectRegisteredAt(kPath + QStringLiteral("/user10002")) ? " | object | " : " | no object | ")
            + m_root.readFile(kSettings).simplified();
        outcome << QString::fromUtf8(state);
        QTEST(outcome, "outcome");
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

    // The passwords go to cache-kest on its standard input, never on its command line, which every local user could
    // read; its reply passes through up to a zero byte. The demo shows a change through the real cache-kest.
    void passwordChange()
    {
        const QVariantList change { QStringLiteral("@alice"), QStringLiteral("old"), QStringLiteral("new") };
        QCOMPARE(call(QStringLiteral("ModifyUserPassword"), change), QVariant(QString())); // no cache-kest yet
        const QString client = QStringLiteral("/bin/cache-kest");
        QVERIFY(m_root.writeFile(client,
            "#!/bin/sh\n{ echo \"$*\"; /bin/cat; } >" + QFile::encodeName(m_root.filePath(QStringLiteral("/noted")))
                + "\nprintf '{\"code\":0}\\0rest'\n"));
        QVERIFY(QFile::setPermissions(m_root.filePath(client), QFile::ReadOwner | QFile::ExeOwner));
        QCOMPARE(call(QStringLiteral("ModifyUserPassword"), change), QVariant(QStringLiteral("{\"code\":0}")));
        QCOMPARE(m_root.readFile(QStringLiteral("/noted")),
            QByteArray(
                "--modify-user-passwd -\n{\"old_password\":\"old\",\"password\":\"new\",\"username\":\"@alice\"}"));
    }

    // gdbus as nobody, as nobody in group sudo and as root: what the bus policy lets through and what the per-user
    // objects show. Only root and the account itself see the stored digest; the bus takes only callers it can
    // find groups for, so the account is one that exists here: nobody, cached as a domain account.
    void bus_data()
    {
        QTest::addColumn<QByteArray>("caller"); // options of setpriv; empty: there is no group sudo
        QTest::addColumn<QByteArray>("path"); // under the service's
        QTest::addColumn<QByteArray>("method"); // and its arguments
        QTest::addColumn<QByteArray>("output"); // null: refused; empty: not looked at
        const auto row
            = [](const char *name, const QByteArray &caller, const char *path, const char *method, const char *output) {
                  QTest::newRow(name) << caller << QByteArray(path) << QByteArray(method) << QByteArray(output);
              };
        const group *sudo = getgrnam("sudo");
        const char *const get = "org.freedesktop.DBus.Properties.Get com.nimbal.kest.iam.user Password";
        const char *const getAll = "org.freedesktop.DBus.Properties.GetAll com.nimbal.kest.iam.user";
        const char *const set = "org.freedesktop.DBus.Properties.Set com.nimbal.kest.iam Enable <true>";
        const QByteArray nobody = kNobody + " --clear-groups";
        row("lists uids", nobody, "", "com.nimbal.kest.iam.GetUserIdList", "");
        row("removes all", nobody, "", "com.nimbal.kest.iam.RemoveAllCacheFiles", nullptr);
        row("writes Enable", nobody, "", set, nullptr);
        row("sudo member writes Enable", sudo ? kNobody + " --groups=" + QByteArray::number(sudo->gr_gid) : "", "", set,
            "()");
        row("another account's Password", nobody, "/user10002", get, "(<'x'>,)");
        row("its own Password", nobody, "/user65534", get, "(<'digest-of-@nobody'>,)");
        // Only root and the account itself may change (and so test) its password: no cache-kest for the others.
        row("changes another's password", nobody, "", "com.nimbal.kest.iam.ModifyUserPassword '@bob' 'old' 'new'",
            R"(('{"code":1,"data":null,"msg":"permission denied !!!"}',))");
        row("changes its own password", nobody, "", "com.nimbal.kest.iam.ModifyUserPassword '@nobody' 'old' 'new'",
            R"(('{"code":0}',))");
        row("root reads an entry", "--reuid=0", "/user10002", getAll,
            "({'Gecos': <'Full Name of @bob'>, 'Gid': <uint32 10102>, 'HomeDir': <'/home/remote/@bob'>, "
            "'Password': <'digest-of-@bob'>, 'Shell': <'/bin/zsh'>, 'Uid': <uint32 10002>, 'UserName': <'@bob'>},)");
        // A record marked for removal has no list entry: its object reads zeros and empty texts.
        row("root reads a removed entry", "--reuid=0", "/user10003", getAll,
            "({'Gecos': <''>, 'Gid': <uint32 0>, 'HomeDir': <''>, 'Password': <''>, 'Shell': <''>, 'Uid': <uint32 0>, "
            "'UserName': <''>},)");
    }

    void bus()
    {
        QFETCH(QByteArray, caller);
        QFETCH(QByteArray, path);
        QFETCH(QByteArray, method);
        QFETCH(QByteArray, output);
        if (caller.isEmpty())
            QSKIP("this machine has no group sudo");
        QVERIFY(writeRecord(65534, QStringLiteral("@nobody")) && writeRecord(10003, QStringLiteral("@carol"), 1));
        announce("c4");
        QProcess client;
        client.start(QStringLiteral("setpriv"),
            QString::fromLatin1(caller + " gdbus call --system --dest " + kName.toLatin1() + " --object-path "
                + kPath.toLatin1() + path + " --method " + method)
                .split(QLatin1Char(' ')));
        QVERIFY(client.waitForFinished(30000));
        QCOMPARE(client.exitCode() == 0, !output.isNull());
        QCOMPARE(client.readAllStandardError().contains("org.freedesktop.DBus.Error.AccessDenied"), output.isNull());
        if (!output.isEmpty())
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
        // A second instance and one not run by root leave, the pid file as it was.
        QProcess second;
        start(second);
        QCOMPARE(exitCodeOf(second), 255);
        QProcess notRoot;
        start(notRoot, {}, QString::fromLatin1("setpriv " + kNobody + " --clear-groups").split(QLatin1Char(' ')));
        QCOMPARE(exitCodeOf(notRoot), 2);
        QCOMPARE(m_root.readFile(kPidFile), pid);

        m_main.terminate();
        QCOMPARE(exitCodeOf(m_main), 15);
        QCOMPARE(m_root.readFile(kPidFile), pid);
        QCOMPARE(QDir(m_guard.path()).entryList({ QStringLiteral("qipc_*") }, QDir::Files), QStringList());
        // Started first and running all along, the idle one took neither the guard nor the name, or the service
        // could not have started.
        QCOMPARE(m_idle.state(), QProcess::Running);
    }

private:
    // The guard's key file goes to TMPDIR; cache-kest is looked for in the root's /bin only.
    void start(QProcess &process, const QStringList &arguments = {}, const QStringList &wrapper = {})
    {
        QProcessEnvironment environment = QProcessEnvironment::systemEnvironment();
        environment.insert(QStringLiteral("TMPDIR"), m_guard.path());
        environment.insert(QStringLiteral("PATH"), m_root.filePath(QStringLiteral("/bin")));
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

    // Sent on the connection of the next call, the signal reaches the service before that call does.
    void announce(const char *session)
    {
        QDBusMessage signal = QDBusMessage::createSignal(
            kLogind, QStringLiteral("org.freedesktop.login1.Manager"), QStringLiteral("SessionNew"));
        signal.setArguments(sessionNew(session));
        QVERIFY(m_conn.send(signal));
        call(QStringLiteral("GetUserIdList"));
    }

    PrivateBus m_bus { QStringLiteral(KEST_POLICY_FILE) };
    TestRoot m_root;
    QTemporaryDir m_guard;
    QDBusConnection m_conn { QString() };
    Peers m_peers;
    QThread m_thread;
    QProcess m_main;
    QProcess m_idle;
};

QTEST_GUILESS_MAIN(DBusKestTest)
#include "test_dbuskest.moc"
