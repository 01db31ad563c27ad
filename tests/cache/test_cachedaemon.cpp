#include "blackhole.h"
#include "cachecontrolfactory.h"
#include "cachedaemonfixture.h"
#include "cachestore.h"
#include "common.h"
#include "domainserverfixture.h"
#include "rawconnection.h"
#include "testroot.h"
#include "userlistmanager.h"

#include <QDir>
#include <QJsonDocument>
#include <QTest>

namespace
{
const QByteArray passTrue = R"({"pass":true})";
const QByteArray passFalse = R"({"pass":false})";
const QByteArray resultOk = R"({"errorMessage":"","retVal":0})";

QByteArray result(const char *message)
{
    return R"({"errorMessage":")" + QByteArray(message) + R"(","retVal":1})";
}

QByteArray status(int code, const char *message)
{
    return R"({"code":)" + QByteArray::number(code) + R"(,"data":null,"msg":")" + message + "\"}";
}

CacheControlPtr loadRecord(uint uid)
{
    CacheControlPtr record = createCacheControl();
    record->setUid(uid);
    return loadCacheRecord(record) ? record : CacheControlPtr();
}

QByteArray command(int number, const QJsonValue &data)
{
    return QJsonDocument(QJsonObject { { QStringLiteral("command"), number }, { QStringLiteral("data"), data } })
        .toJson(QJsonDocument::Compact);
}

QByteArray lookUpCall(const char *name)
{
    return CacheDaemonFixture::functionCall(QStringLiteral("queryAccountName"), { QLatin1String(name) });
}

// A daemon in a fresh root beside a running domain server; offline login allowed for a day.
struct Setup {
    TestRoot root;
    DomainServerFixture server;
    CacheDaemonFixture daemon;

    bool start()
    {
        return server.isValid() && server.start()
            && root.writeSettings(server.settingsIni({ { QStringLiteral("main/enable"), true },
                { QStringLiteral("main/network-timeout"), 2 }, { QStringLiteral("offline_login/enable"), true },
                { QStringLiteral("offline_login/cache_validity"), 1 } }))
            && daemon.start();
    }
    QByteArray lookUp(const char *name) const { return daemon.request(lookUpCall(name)); }
    QByteArray login(const char *name, const char *password) const
    {
        return daemon.call(QStringLiteral("authenticatePassword"), { QLatin1String(name), QLatin1String(password) });
    }
    // The command line's exit code, a blank, its output and what it wrote to stderr after "stderr: ".
    QByteArray client(const char *option, const QByteArray &argument = QByteArray()) const
    {
        QProcess client;
        client.start(CacheDaemonFixture::programPath(),
            QStringList { QLatin1String(option), QString::fromUtf8(argument) }.mid(0, argument.isNull() ? 1 : 2));
        if (!client.waitForFinished(60000) || client.exitStatus() != QProcess::NormalExit)
            return "did not finish";
        const QByteArray err = client.readAllStandardError();
        return QByteArray::number(client.exitCode()) + ' ' + client.readAllStandardOutput()
            + (err.isEmpty() ? "" : "stderr: " + err);
    }
    bool exists(uint uid) const { return QFile::exists(root.workDir() + QLatin1Char('/') + QString::number(uid)); }
};

// The way the machine's modules ask: socket_query, with its 5 s receive time-out.
QByteArray moduleCall(const char *function, const QStringList &argv)
{
    const QByteArray frame = CacheDaemonFixture::frame(CacheDaemonFixture::functionCall(QLatin1String(function), argv));
    unsigned char reply[4096];
    if (!socket_query(frame.constData(), size_t(frame.size()), reply, sizeof(reply)))
        return "no answer";
    return QByteArray(reinterpret_cast<const char *>(reply));
}
} // namespace

// The real cache-kest against the test domain server, the way the machine's modules use it.
class CacheDaemonTest : public QObject
{
    Q_OBJECT
    QScopedPointer<Setup> s;

private Q_SLOTS:
    void init()
    {
        s.reset(new Setup);
        QVERIFY2(s->start(), qPrintable(s->server.errorText() + s->daemon.errorText()));
    }
    void cleanup() { s.reset(); }

    // Only a password the server took leaves a digest for offline logins; the login hands the home to its account.
    void login()
    {
        const QString home = s->root.filePath(QStringLiteral("/home/@alice"));
        QVERIFY(QDir().mkpath(home) && s->root.writeFile(QStringLiteral("/home/@alice/notes"), "x"));
        QCOMPARE(s->lookUp("@alice"), passTrue);
        QCOMPARE(s->login("@alice", "wrong"), passFalse);
        QCOMPARE(loadRecord(10001)->password(), QStringLiteral("x"));
        QCOMPARE(s->login("@alice", "alice-password"), passTrue);
        QCOMPARE(loadRecord(10001)->password(), UserListManager::passwordDigest(QStringLiteral("alice-password")));
        // The name-service module's entry comes from the cache and never carries the digest.
        QCOMPARE(s->daemon.call(QStringLiteral("getAccountByName"), { QStringLiteral("@alice") }),
            R"({"pass":true,"user":{"gecos":"Alice","gid":10000,"home":"/home/alice","name":"@alice","shell":"/bin/bash","uid":10001}})");
        const QFileInfo info(home);
        QCOMPARE(QStringLiteral("%1:%2").arg(info.ownerId()).arg(info.groupId()), QStringLiteral("10001:10000"));
    }

    // A server that hands out a uid of the machine's own range is not believed: nothing is cached.
    void localUidFromTheServerWritesNothing()
    {
        const QByteArray data = QJsonDocument(DomainServerFixture::defaultData()).toJson().replace("10001", "9999");
        QVERIFY(s->server.setData(QJsonDocument::fromJson(data).object()));
        QCOMPARE(s->lookUp("@alice"), passFalse);
        QCOMPARE(s->login("@alice", "alice-password"), passFalse);
        QCOMPARE(QDir(s->root.workDir()).entryList(QDir::Files), QStringList { QStringLiteral("groups.txt") });
    }

    // An impostor's certificate counts as an unreachable server: nothing it says is used, and the
    // start-up refresh keeps what is cached.
    void impostorServer()
    {
        QCOMPARE(s->login("@alice", "alice-password"), passTrue);
        s->daemon.stop();
        QVERIFY(s->server.start(s->server.port(), false, QStringLiteral("expired")));
        QVERIFY2(s->daemon.start(), qPrintable(s->daemon.errorText()));
        QCOMPARE(s->lookUp("@bob"), passFalse);
        QCOMPARE(s->lookUp("@alice"), passTrue);
        QCOMPARE(s->login("@alice", "alice-password"), passTrue);
        QTest::qWait(1500); // the start-up refresh has run
        QCOMPARE(QDir(s->root.workDir()).entryList({ QStringLiteral("1*") }), QStringList { QStringLiteral("10001") });
    }

    // A client that gives up while the server is slow costs only its own answer.
    void clientLeavesDuringSlowAnswer()
    {
        QVERIFY(s->server.setMisbehaviour(QStringLiteral("/v3/account/"), QStringLiteral("delay:1000")));
        RawConnection leaving(s->daemon.port()), waiting(s->daemon.port());
        leaving.send(CacheDaemonFixture::frame(lookUpCall("@alice")));
        waiting.send(CacheDaemonFixture::frame(lookUpCall("@bob")));
        QTest::qWait(200);
        leaving.abort();
        QCOMPARE(waiting.reply(10000), passTrue);
        QVERIFY(s->exists(10001) && s->exists(10002) && s->daemon.isRunning());
    }

    // A server whose SYNs go unanswered: the modules' client, which waits 5 s, still gets every answer
    // from the cache, and only the password the server took opens it.
    void blackholedServer()
    {
        QCOMPARE(s->lookUp("@bob"), passTrue);
        QCOMPARE(s->login("@alice", "alice-password"), passTrue);
        s->server.stop();
        Blackhole blackhole(DomainServerFixture::address(), s->server.port());
        QVERIFY(blackhole.isFull());
        const auto login = [](const char *name, const char *password) {
            return moduleCall("authenticatePassword", { QLatin1String(name), QLatin1String(password) });
        };
        for (int i = 0; i < 3; ++i) {
            QCOMPARE(moduleCall("queryAccountName", { QStringLiteral("@alice") }), passTrue);
            QCOMPARE(login("@alice", "alice-password"), passTrue);
        }
        QCOMPARE(login("@alice", "wrong"), passFalse);
        QCOMPARE(login("@bob", "bob-password"), passFalse); // looked up, never logged in
        blackhole.close();
        QVERIFY(s->server.start(s->server.port()));
        QTest::qWait(2500); // the daemon's once-a-second probe
        s->server.clearRequests();
        QCOMPARE(moduleCall("queryAccountName", { QStringLiteral("@alice") }), passTrue);
        QCOMPARE(s->server.requests().size(), 1);
    }

    void refreshOnceTheServerIsBack()
    {
        s->daemon.stop();
        s->server.stop();
        CacheControlPtr record = createCacheControl();
        for (const char *json : { R"({"version":16777216,"uid":10001,"account":"@alice","gecos":"old"})",
                 R"({"version":16777216,"uid":10099,"account":"@ghost"})" })
            QVERIFY(cacheRecordFromJson(record, QLatin1String(json)) && saveCacheRecord(*record));
        QVERIFY2(s->daemon.start(), qPrintable(s->daemon.errorText()));
        QTest::qWait(1500);
        QVERIFY(s->exists(10099));
        QVERIFY(s->server.start(s->server.port()));
        QTRY_VERIFY_WITH_TIMEOUT(!s->exists(10099), 15000);
        QTRY_COMPARE_WITH_TIMEOUT(loadRecord(10001)->gecos(), QStringLiteral("Alice"), 15000);
    }

    // Only a change the server accepted may replace the digest kept for offline logins; malformed requests
    // and local accounts go no further than the daemon.
    void passwordChange()
    {
        QCOMPARE(s->login("@alice", "alice-password"), passTrue);
        const auto change
            = [this](const char *argument) { return s->client("--modify-user-passwd", argument).mid(2).chopped(1); };
        QCOMPARE(change(R"({"username":"@alice","password":"new-pass","old_password":"guess"})"),
            status(1, "old password is wrong"));
        QCOMPARE(change("{username"), status(1, "json格式解析错误"));
        QCOMPARE(change(R"({"username":"@alice","password":"p"})"),
            status(2, "请求消息缺少必要的字段,username,password,old_password"));
        QCOMPARE(change(R"({"username":"root","password":"new-pass","old_password":"b"})"),
            status(3, "校验域账号失败,不能查询到此账户信息"));
        const auto modifyUser = [this](const char *json) {
            return s->daemon.call(QStringLiteral("modifyUser"), { QString::fromUtf8(json) });
        };
        QCOMPARE(modifyUser("[]"), status(1, "json解析失败"));
        QCOMPARE(modifyUser(R"({"username":"@alice"})"), status(2, "json解析失败,缺少必要的字段"));
        QCOMPARE(loadRecord(10001)->password(), UserListManager::passwordDigest(QStringLiteral("alice-password")));
    }

    // Root's commands change the cache and the policy; any other local user may only look up.
    void serverCommands()
    {
        QCOMPARE(s->lookUp("@alice"), passTrue);
        QCOMPARE(s->lookUp("@bob"), passTrue);
        const auto run = [this](const char *option, const char *argument) {
            return s->client(option, argument).mid(2).chopped(1);
        };
        const QByteArray noCache = result("[CleanCache] : cache file not exists!!!");
        // The command line sends every argument as text: UpdateCache then reads uid 0, CleanCache a number as "".
        QCOMPARE(run("--update-cache", "10001"), result("[UpdateCache] : cache file not exists!!!"));
        QCOMPARE(s->daemon.request(command(3, 10001)), resultOk);
        QCOMPARE(run("--clean-cache", "10002"), resultOk);
        QVERIFY(!s->exists(10002));
        QCOMPARE(run("--clean-cache", "10002"), noCache);
        QCOMPARE(s->daemon.request(command(1, 10001)), noCache);

        QCOMPARE(s->lookUp("@bob"), passTrue);
        QCOMPARE(run("--clean-cache-not-in-list", R"({"whitelist":[10001,"10002"]})"), resultOk);
        QVERIFY(s->exists(10001) && !s->exists(10002));
        QCOMPARE(
            s->daemon.request(command(2, QStringLiteral("{"))), result("[CleanCacheNotInList] : json parse error!!!"));

        QCOMPARE(
            s->daemon.request(command(4,
                QStringLiteral(
                    R"({"pw_strength":{"min_length":8,"strength":1},)"
                    R"("pw_validity":{},"pw_history_check":{},"first_login":{},"offline_login":{"cache_validity":3}})"))),
            resultOk);
        const QByteArray written = s->root.readFile(QStringLiteral("/etc/kest-iam.conf"));
        QVERIFY(written.contains("[pw_strength]\nmin_length=8\nstrength=true\n") && written.contains("cache_validity=3")
            && written.contains("enable=true"));
        QCOMPARE(s->daemon.request(command(4, QStringLiteral(R"({"pw_strength":{}})"))),
            result("[PasswordConfig] : pw-config json missing field,[pw_strength pw_validity pw_history_check "
                   "first_login offline_login]"));
        QCOMPARE(s->daemon.request(command(4, QStringLiteral("nope"))),
            result("[PasswordConfig] : pw-config json parse error!!!"));
        QCOMPARE(s->daemon.requestAsUser(65534, command(2, QStringLiteral(R"({"whitelist":[]})"))),
            result("permission denied !!!"));
        QVERIFY(s->exists(10001));
        QCOMPARE(s->daemon.requestAsUser(65534, command(4, QStringLiteral("{}"))), result("permission denied !!!"));
        QCOMPARE(s->daemon.requestAsUser(65534, lookUpCall("@alice")), passTrue);
    }

    void commandLineAndLifecycle()
    {
        QCOMPARE(s->lookUp("@alice"), passTrue);
        QCOMPARE(s->client("--show-cache", "10001"),
            QByteArray(
                "0 uid: 10001\ngid: 10000\naccount: @alice\ndirectory: /home/alice\nshell: /bin/bash\ngecos: Alice\n"));
        QCOMPARE(s->client("--show-cache", "10009"), QByteArray("1 stderr: read cache file failed!!!\n"));
        QCOMPARE(s->client("--version"), QByteArray("0 cache-kest 1.0\n"));

        // A second daemon cannot listen and leaves the first one's pid file alone; not root, it ends with 2.
        const QByteArray pid = s->root.readFile(QStringLiteral("/run/cache-kest.pid"));
        QCOMPARE(QProcess::execute(CacheDaemonFixture::programPath(), {}), 1);
        QCOMPARE(s->root.readFile(QStringLiteral("/run/cache-kest.pid")), pid);
        QCOMPARE(QProcess::execute(QStringLiteral("setpriv"),
                     { QStringLiteral("--reuid=65534"), QStringLiteral("--regid=65534"),
                         QStringLiteral("--clear-groups"), CacheDaemonFixture::programPath() }),
            2);
        QCOMPARE(s->daemon.stop(), 0);
        QVERIFY(s->client("--clean-cache", "1").startsWith("1 stderr: cannot connect to cache-kest on 127.0.0.1:"));
    }
};

QTEST_GUILESS_MAIN(CacheDaemonTest)
#include "test_cachedaemon.moc"
