#include "blackhole.h"
#include "cachecontrolfactory.h"
#include "cachedaemonfixture.h"
#include "cachestore.h"
#include "domainserverfixture.h"
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

// Several replies compared at once; a braced list makes the calls in the order written.
using Replies = QByteArrayList;

QByteArray result(const char *message)
{
    return R"({"errorMessage":")" + QByteArray(message) + R"(","retVal":1})";
}

QByteArray status(int code, const char *message)
{
    return R"({"code":)" + QByteArray::number(code) + R"(,"data":null,"msg":")" + message + "\"}";
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
    // The command line's trimmed output when it ends with 0 and no error, else "<exit code> <output>stderr: <error>".
    QByteArray run(const char *option, const char *argument) const
    {
        QProcess client;
        client.start(CacheDaemonFixture::programPath(), { QLatin1String(option), QString::fromUtf8(argument) });
        if (!client.waitForFinished(60000) || client.exitStatus() != QProcess::NormalExit)
            return "did not finish";
        const QByteArray out = client.readAllStandardOutput(), err = client.readAllStandardError();
        return client.exitCode() == 0 && err.isEmpty()
            ? out.trimmed()
            : QByteArray::number(client.exitCode()) + ' ' + out + "stderr: " + err;
    }
    bool exists(uint uid) const { return QFile::exists(root.workDir() + QLatin1Char('/') + QString::number(uid)); }
};
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

    // Look-ups, logins and password changes while the server answers, then while its SYNs go unanswered. That the
    // daemon finds the server again once it is back is the demo's last step.
    void lookUpsLoginsAndChanges()
    {
        QCOMPARE(
            (Replies { s->lookUp("@alice"), s->lookUp("@bob"), s->lookUp("@nobody"), s->login("@alice", "wrong") }),
            (Replies { passTrue, passTrue, passFalse, passFalse }));
        QVERIFY(s->exists(10001) && s->exists(10002));
        QCOMPARE(readCacheRecord(10001)->password(), QStringLiteral("x"));
        QCOMPARE(s->login("@alice", "alice-password"), passTrue);
        QCOMPARE(readCacheRecord(10001)->password(), UserListManager::passwordDigest(QStringLiteral("alice-password")));
        // The name-service module's entry comes from the cache and never carries the digest.
        QCOMPARE(s->daemon.call(QStringLiteral("getAccountByName"), { QStringLiteral("@alice") }),
            R"({"pass":true,"user":{"gecos":"Alice","gid":10000,"home":"/home/alice","name":"@alice","shell":"/bin/bash","uid":10001}})");

        // Only a change the server accepted may replace the digest kept for offline logins (tried offline below);
        // malformed requests and local accounts go no further than the daemon.
        const auto change = [this](const char *argument) { return s->run("--modify-user-passwd", argument); };
        QCOMPARE(change(R"({"username":"@alice","password":"new-pass","old_password":"guess"})"),
            status(1, "old password is wrong"));
        QCOMPARE(change("{username"), status(1, "json格式解析错误"));
        QCOMPARE(change(R"({"username":"@alice","password":"p"})"),
            status(2, "请求消息缺少必要的字段,username,password,old_password"));
        QCOMPARE(change(R"({"username":"root","password":"new-pass","old_password":"b"})"),
            status(3, "校验域账号失败,不能查询到此账户信息"));
        QCOMPARE(s->daemon.call(QStringLiteral("modifyUser"), { QStringLiteral("[]") }), status(1, "json解析失败"));
        QCOMPARE(s->daemon.call(QStringLiteral("modifyUser"), { QStringLiteral(R"({"username":"@alice"})") }),
            status(2, "json解析失败,缺少必要的字段"));

        // Answers come from the cache, and only the password the server took opens it; bob was looked up but
        // never logged in. How long the modules may wait is their own test's business.
        s->server.stop();
        Blackhole blackhole(DomainServerFixture::address(), s->server.port());
        QVERIFY(blackhole.isFull());
        QCOMPARE(change(R"({"username":"@alice","password":"new-pass","old_password":"alice-password"})"),
            status(4, "网络错误,无法修改密码"));
        QCOMPARE((Replies { s->lookUp("@alice"), s->login("@alice", "alice-password"), s->login("@alice", "new-pass"),
                     s->login("@bob", "bob-password") }),
            (Replies { passTrue, passTrue, passFalse, passFalse }));
    }

    // A server that hands out a uid of the machine's own range is not believed: nothing is cached. What is
    // cached outlives the server: kept while it is away, refreshed once it is back, and kept when the start-up
    // refresh meets an impostor's certificate, whose server counts as unreachable.
    void cacheOutlivesTheServer()
    {
        const QByteArray data = QJsonDocument(DomainServerFixture::defaultData()).toJson().replace("10001", "9999");
        QVERIFY(s->server.setData(QJsonDocument::fromJson(data).object()));
        QCOMPARE((Replies { s->lookUp("@alice"), s->login("@alice", "alice-password") }),
            (Replies { passFalse, passFalse }));
        QCOMPARE(QDir(s->root.workDir()).entryList(QDir::Files), QStringList { QStringLiteral("groups.txt") });
        QVERIFY(s->server.setData(DomainServerFixture::defaultData()));

        QCOMPARE(s->login("@alice", "alice-password"), passTrue);
        s->daemon.stop();
        s->server.stop();
        CacheControlPtr ghost = createCacheControl();
        QVERIFY(cacheRecordFromJson(ghost, QStringLiteral(R"({"version":16777216,"uid":10099,"account":"@ghost"})"))
            && saveCacheRecord(*ghost));
        QVERIFY2(s->daemon.start(), qPrintable(s->daemon.errorText()));
        QTest::qWait(1500);
        QVERIFY(s->exists(10099));
        QVERIFY(s->server.start(s->server.port()));
        QTRY_VERIFY_WITH_TIMEOUT(!s->exists(10099), 15000);

        s->daemon.stop();
        QVERIFY(s->server.start(s->server.port(), false, QStringLiteral("expired")));
        QVERIFY2(s->daemon.start(), qPrintable(s->daemon.errorText()));
        QCOMPARE((Replies { s->lookUp("@bob"), s->lookUp("@alice"), s->login("@alice", "alice-password") }),
            (Replies { passFalse, passTrue, passTrue }));
        QTest::qWait(1500); // the start-up refresh has run
        QCOMPARE(QDir(s->root.workDir()).entryList({ QStringLiteral("1*") }), QStringList { QStringLiteral("10001") });
    }

    // Root's commands change the cache and the policy; any other local user may only look up. Then the
    // daemon's life as the command line and a second daemon see it.
    void commandsAndLifecycle()
    {
        QCOMPARE((Replies { s->lookUp("@alice"), s->lookUp("@bob") }), (Replies { passTrue, passTrue }));
        const auto asRoot = [this](int n, const QJsonValue &data) { return s->daemon.request(command(n, data)); };
        const auto asNobody = [this](const QByteArray &request) { return s->daemon.requestAsUser(65534, request); };
        // The command line sends every argument as text: UpdateCache then reads uid 0, CleanCache a number as "".
        const QByteArray missing = result("[CleanCache] : cache file not exists!!!");
        QCOMPARE((Replies { s->run("--update-cache", "10001"), asRoot(3, 10001), s->run("--clean-cache", "10002") }),
            (Replies { result("[UpdateCache] : cache file not exists!!!"), resultOk, resultOk }));
        QVERIFY(!s->exists(10002));
        QCOMPARE((Replies { s->run("--clean-cache", "10002"), asRoot(1, 10001), s->lookUp("@bob"),
                     s->run("--clean-cache-not-in-list", R"({"whitelist":[10001,"10002"]})"),
                     asRoot(2, QStringLiteral("{")) }),
            (Replies { missing, missing, passTrue, resultOk, result("[CleanCacheNotInList] : json parse error!!!") }));
        QVERIFY(s->exists(10001) && !s->exists(10002));

        QCOMPARE(asRoot(4,
                     QStringLiteral(R"({"pw_strength":{"min_length":8,"strength":1},"pw_validity":{},)"
                                    R"("pw_history_check":{},"first_login":{},"offline_login":{"cache_validity":3}})")),
            resultOk);
        const QByteArray written = s->root.readFile(QStringLiteral("/etc/kest-iam.conf"));
        QVERIFY(written.contains("[pw_strength]\nmin_length=8\nstrength=true\n") && written.contains("cache_validity=3")
            && written.contains("enable=true"));
        QCOMPARE((Replies { asRoot(4, QStringLiteral(R"({"pw_strength":{}})")), asRoot(4, QStringLiteral("nope")) }),
            (Replies { result("[PasswordConfig] : pw-config json missing field,[pw_strength pw_validity "
                              "pw_history_check first_login offline_login]"),
                result("[PasswordConfig] : pw-config json parse error!!!") }));
        const QByteArray denied = result("permission denied !!!");
        QCOMPARE((Replies { asNobody(command(2, QStringLiteral(R"({"whitelist":[]})"))),
                     asNobody(command(4, QStringLiteral("{}"))), asNobody(lookUpCall("@alice")) }),
            (Replies { denied, denied, passTrue }));

        QCOMPARE(s->run("--show-cache", "10001"),
            QByteArray(
                "uid: 10001\ngid: 10000\naccount: @alice\ndirectory: /home/alice\nshell: /bin/bash\ngecos: Alice"));
        QCOMPARE(s->run("--show-cache", "10009"), QByteArray("1 stderr: read cache file failed!!!\n"));
        // A second daemon cannot listen and leaves the first one's pid file alone; not root, it ends with 2.
        const QByteArray pid = s->root.readFile(QStringLiteral("/run/cache-kest.pid"));
        QCOMPARE(QProcess::execute(CacheDaemonFixture::programPath(), {}), 1);
        QCOMPARE(s->root.readFile(QStringLiteral("/run/cache-kest.pid")), pid);
        QCOMPARE(QProcess::execute(QStringLiteral("setpriv"),
                     QStringLiteral("--reuid=65534 --regid=65534 --clear-groups").split(QLatin1Char(' '))
                         << CacheDaemonFixture::programPath()),
            2);
        QCOMPARE(s->daemon.stop(), 0);
        QVERIFY(s->run("--clean-cache", "1").startsWith("1 stderr: cannot connect to cache-kest on 127.0.0.1:"));
    }
};

QTEST_GUILESS_MAIN(CacheDaemonTest)
#include "test_cachedaemon.moc"
