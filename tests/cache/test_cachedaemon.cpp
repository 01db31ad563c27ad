#include "cachecontrolfactory.h"
#include "cachedaemonfixture.h"
#include "cachestore.h"
#include "domainserverfixture.h"
#include "testroot.h"
#include "userlistmanager.h"

#include <QDateTime>
#include <QDir>
#include <QJsonArray>
#include <QJsonDocument>
#include <QTest>

#include <sys/stat.h>

namespace
{
const QByteArray passTrue = R"({"pass":true})";
const QByteArray passFalse = R"({"pass":false})";
const QByteArray resultOk = R"({"errorMessage":"","retVal":0})";

QByteArray result(const char *message)
{
    return R"({"errorMessage":")" + QByteArray(message) + R"(","retVal":1})";
}

CacheControlPtr loadRecord(uint uid)
{
    CacheControlPtr record = createCacheControl();
    record->setUid(uid);
    return loadCacheRecord(record) ? record : CacheControlPtr();
}

QByteArray passwordRequest(const char *user, const char *newPassword, const char *oldPassword)
{
    return QByteArray(R"({"username":"%1","password":"%2","old_password":"%3"})")
        .replace("%1", user)
        .replace("%2", newPassword)
        .replace("%3", oldPassword);
}

QByteArray command(int number, const QJsonValue &data)
{
    return QJsonDocument(QJsonObject { { QStringLiteral("command"), number }, { QStringLiteral("data"), data } })
        .toJson(QJsonDocument::Compact);
}

struct Setup {
    TestRoot root;
    DomainServerFixture server;
    CacheDaemonFixture daemon;

    // A daemon in a fresh root beside a running domain server; offline login allowed for a day.
    bool start()
    {
        return server.isValid() && server.start()
            && root.writeSettings(server.settingsIni({ { QStringLiteral("main/enable"), true },
                { QStringLiteral("main/network-timeout"), 2 }, { QStringLiteral("offline_login/enable"), true },
                { QStringLiteral("offline_login/cache_validity"), 1 } }))
            && daemon.start();
    }
    QByteArray lookUp(const QString &name) const { return daemon.call(QStringLiteral("queryAccountName"), { name }); }
    QByteArray login(const QString &name, const QString &password) const
    {
        return daemon.call(QStringLiteral("authenticatePassword"), { name, password });
    }
    bool exists(uint uid) const
    {
        return QFile::exists(root.filePath(QStringLiteral("/var/lib/libkest-iam/") + QString::number(uid)));
    }
};
} // namespace

// The real cache-kest against the test domain server, the way the machine's modules use it.
class CacheDaemonTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void lookUpsAndLogins()
    {
        Setup setup;
        QVERIFY2(setup.start(), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        QCOMPARE(setup.lookUp(QStringLiteral("@nobody")), passFalse);
        setup.server.clearRequests();
        QCOMPARE(setup.lookUp(QStringLiteral("root")), passFalse); // not a domain name: the server is not asked
        QVERIFY(setup.server.requests().isEmpty());
        QCOMPARE(setup.lookUp(QStringLiteral("@alice")), passTrue);
        QCOMPARE(loadRecord(10001)->password(), QStringLiteral("x"));
        QVERIFY(setup.root.readFile(QStringLiteral("/var/lib/libkest-iam/groups.txt")).contains("@alice"));
        QCOMPARE(setup.daemon.call(QStringLiteral("queryUid"), { QStringLiteral("10002") }), passTrue);
        QCOMPARE(loadRecord(10002)->account(), QStringLiteral("@bob"));
        QCOMPARE(setup.daemon.call(QStringLiteral("queryUid"), { QStringLiteral("10077") }), passFalse);

        const QString home = setup.root.filePath(QStringLiteral("/home/@alice"));
        QVERIFY(QDir().mkpath(home) && setup.root.writeFile(QStringLiteral("/home/@alice/notes"), "x"));
        QCOMPARE(setup.login(QStringLiteral("@alice"), QStringLiteral("wrong")), passFalse);
        QCOMPARE(loadRecord(10001)->password(), QStringLiteral("x"));
        QCOMPARE(setup.login(QStringLiteral("@alice"), QStringLiteral("alice-password")), passTrue);
        QCOMPARE(loadRecord(10001)->password(), UserListManager::passwordDigest(QStringLiteral("alice-password")));
        QVERIFY(loadRecord(10001)->lastLoginTime() + 60 >= quint64(QDateTime::currentSecsSinceEpoch()));
        struct stat info;
        QCOMPARE(stat(QFile::encodeName(home).constData(), &info), 0);
        QCOMPARE(info.st_uid, uid_t(10001));
        QCOMPARE(info.st_gid, gid_t(10000));

        setup.server.stop();
        QCOMPARE(setup.lookUp(QStringLiteral("@alice")), passTrue);
        QCOMPARE(setup.lookUp(QStringLiteral("@carol")), passFalse);
        QCOMPARE(setup.login(QStringLiteral("@alice"), QStringLiteral("alice-password")), passTrue);
        QCOMPARE(setup.login(QStringLiteral("@alice"), QStringLiteral("wrong")), passFalse);
        QCOMPARE(setup.login(QStringLiteral("@bob"), QStringLiteral("bob-password")), passFalse);
    }

    void offlinePolicy_data()
    {
        QTest::addColumn<bool>("enabled");
        QTest::addColumn<int>("validityDays");
        QTest::addColumn<qint64>("lastLoginAgo");
        QTest::addColumn<uint>("removeStatus");
        QTest::addColumn<QByteArray>("expected");
        QTest::newRow("allowed") << true << 2 << qint64(86400) << 0u << passTrue;
        QTest::newRow("switched off") << false << 2 << qint64(86400) << 0u << passFalse;
        QTest::newRow("expired") << true << 1 << qint64(2 * 86400) << 0u << passFalse;
        QTest::newRow("marked for removal") << true << 2 << qint64(0) << 1u << passFalse;
    }

    void offlinePolicy()
    {
        QFETCH(bool, enabled);
        QFETCH(int, validityDays);
        QFETCH(qint64, lastLoginAgo);
        QFETCH(uint, removeStatus);
        QFETCH(QByteArray, expected);
        Setup setup;
        QVERIFY2(setup.start(), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        QCOMPARE(setup.login(QStringLiteral("@alice"), QStringLiteral("alice-password")), passTrue);
        setup.server.stop();
        CacheControlPtr alice = loadRecord(10001);
        alice->setLastLoginTime(quint64(QDateTime::currentSecsSinceEpoch() - lastLoginAgo));
        alice->setRemoveStatus(removeStatus);
        QVERIFY(saveCacheRecord(*alice));
        QVERIFY(setup.root.writeSettings(setup.server.settingsIni(
            { { QStringLiteral("main/enable"), true }, { QStringLiteral("offline_login/enable"), enabled },
                { QStringLiteral("offline_login/cache_validity"), validityDays } })));
        QCOMPARE(setup.login(QStringLiteral("@alice"), QStringLiteral("alice-password")), expected);
        QCOMPARE(
            setup.login(QStringLiteral("@alice"), QStringLiteral("x")), passFalse); // "x" is refused before anything
    }

    void garbageFromTheServerWritesNothing_data()
    {
        QTest::addColumn<QString>("misbehaviour"); // empty: alice's uid is 9999 instead
        QTest::newRow("not JSON") << QStringLiteral("not-json");
        QTest::newRow("no msg") << QStringLiteral("no-msg");
        QTest::newRow("too slow") << QStringLiteral("delay:4000");
        QTest::newRow("closes the connection") << QStringLiteral("close");
        QTest::newRow("uid below 10000") << QString();
    }

    void garbageFromTheServerWritesNothing()
    {
        QFETCH(QString, misbehaviour);
        Setup setup;
        QVERIFY2(setup.start(), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        if (!misbehaviour.isEmpty()) {
            QVERIFY(setup.server.setMisbehaviour(QStringLiteral("/v3/account/"), misbehaviour));
        } else {
            QJsonObject data = DomainServerFixture::defaultData();
            QJsonArray users = data.value(QLatin1String("users")).toArray();
            QJsonObject alice = users.at(0).toObject();
            alice.insert(QStringLiteral("uid"), 9999);
            users.replace(0, alice);
            data.insert(QStringLiteral("users"), users);
            QVERIFY(setup.server.setData(data));
        }
        QCOMPARE(setup.lookUp(QStringLiteral("@alice")), passFalse);
        QCOMPARE(setup.login(QStringLiteral("@alice"), QStringLiteral("alice-password")), passFalse);
        QCOMPARE(QDir(setup.root.workDir()).entryList(QDir::Files), QStringList { QStringLiteral("groups.txt") });
    }

    void refreshOnceTheServerIsBack()
    {
        Setup setup;
        QVERIFY(setup.server.isValid() && setup.server.start());
        const quint16 port = setup.server.port();
        setup.server.stop();
        QVERIFY(setup.root.writeSettings(setup.server.settingsIni({ { QStringLiteral("main/enable"), true } })));
        CacheControlPtr record = createCacheControl();
        QVERIFY(cacheRecordFromJson(
                    record, QStringLiteral(R"({"version":16777216,"uid":10001,"account":"@alice","gecos":"old"})"))
            && saveCacheRecord(*record));
        QVERIFY(cacheRecordFromJson(record, QStringLiteral(R"({"version":16777216,"uid":10099,"account":"@ghost"})"))
            && saveCacheRecord(*record));
        QVERIFY2(setup.daemon.start(), qPrintable(setup.daemon.errorText()));
        QTest::qWait(1500);
        QVERIFY(setup.exists(10099));
        QVERIFY(setup.server.start(port));
        QTRY_VERIFY_WITH_TIMEOUT(!setup.exists(10099), 15000);
        QTRY_COMPARE_WITH_TIMEOUT(loadRecord(10001)->gecos(), QStringLiteral("Alice"), 15000);
    }

    void passwordChange_data()
    {
        QTest::addColumn<QByteArray>("argument");
        QTest::addColumn<bool>("serverUp");
        QTest::addColumn<QByteArray>("expected"); // the reply, or "code:N" for the server's own answer
        QTest::newRow("changed") << passwordRequest("@alice", "new-pass", "alice-password") << true
                                 << QByteArray("code:0");
        QTest::newRow("wrong old password")
            << passwordRequest("@alice", "new-pass", "guess") << true << QByteArray("code:1");
        QTest::newRow("not JSON") << QByteArray("{username") << true
                                  << QByteArray(R"({"code":1,"data":null,"msg":"json格式解析错误"})");
        QTest::newRow("missing field")
            << QByteArray(R"({"username":"@alice","password":"p"})") << true
            << QByteArray(R"({"code":2,"data":null,"msg":"请求消息缺少必要的字段,username,password,old_password"})");
        QTest::newRow("local account") << passwordRequest("root", "a",
            "b") << true << QByteArray(R"({"code":3,"data":null,"msg":"校验域账号失败,不能查询到此账户信息"})");
        QTest::newRow("server down") << passwordRequest("@alice", "new-pass", "alice-password") << false
                                     << QByteArray(R"({"code":4,"data":null,"msg":"网络错误,无法修改密码"})");
    }

    void passwordChange()
    {
        QFETCH(QByteArray, argument);
        QFETCH(bool, serverUp);
        QFETCH(QByteArray, expected);
        Setup setup;
        QVERIFY2(setup.start(), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        QCOMPARE(setup.login(QStringLiteral("@alice"), QStringLiteral("alice-password")), passTrue);
        if (!serverUp)
            setup.server.stop();
        QByteArray out;
        QCOMPARE(
            setup.daemon.runClient({ QStringLiteral("--modify-user-passwd"), QString::fromUtf8(argument) }, &out), 0);
        QVERIFY(out.endsWith('\n'));
        if (expected.startsWith("code:"))
            QCOMPARE(
                QJsonDocument::fromJson(out).object().value(QLatin1String("code")).toInt(-1), expected.mid(5).toInt());
        else
            QCOMPARE(out.trimmed(), expected);
        // Only a change the server accepted replaces the digest kept for offline logins.
        const char *password = expected == "code:0" ? "new-pass" : "alice-password";
        QCOMPARE(loadRecord(10001)->password(), UserListManager::passwordDigest(QString::fromLatin1(password)));
        if (expected == "code:0")
            QCOMPARE(setup.login(QStringLiteral("@alice"), QStringLiteral("new-pass")), passTrue);
    }

    void serverCommands()
    {
        Setup setup;
        QVERIFY2(setup.start(), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        QCOMPARE(setup.lookUp(QStringLiteral("@alice")), passTrue);
        QCOMPARE(setup.lookUp(QStringLiteral("@bob")), passTrue);
        const auto client = [&setup](const QString &option, const QString &argument) {
            QByteArray out;
            return setup.daemon.runClient({ option, argument }, &out) == 0 ? out : QByteArray("failed");
        };
        // The command line sends every argument as text: UpdateCache then reads uid 0.
        QCOMPARE(client(QStringLiteral("--update-cache"), QStringLiteral("10001")),
            result("[UpdateCache] : cache file not exists!!!") + '\n');
        QCOMPARE(setup.daemon.request(command(3, 10001)), resultOk);
        QCOMPARE(client(QStringLiteral("--clean-cache"), QStringLiteral("10002")), resultOk + '\n');
        QVERIFY(!setup.exists(10002));
        QCOMPARE(client(QStringLiteral("--clean-cache"), QStringLiteral("10002")),
            result("[CleanCache] : cache file not exists!!!") + '\n');
        QCOMPARE(setup.daemon.request(command(1, 10001)), result("[CleanCache] : cache file not exists!!!"));

        QCOMPARE(setup.lookUp(QStringLiteral("@bob")), passTrue);
        QCOMPARE(
            client(QStringLiteral("--clean-cache-not-in-list"), QStringLiteral(R"({"whitelist":[10001,"10002"]})")),
            resultOk + '\n');
        QVERIFY(setup.exists(10001) && !setup.exists(10002));
        QCOMPARE(setup.daemon.request(command(2, QStringLiteral("{"))),
            result("[CleanCacheNotInList] : json parse error!!!"));

        const QByteArray policy
            = R"({"pw_strength":{"min_length":8,"strength":1},"pw_validity":{},"pw_history_check":{},"first_login":{},"offline_login":{"cache_validity":3}})";
        QCOMPARE(setup.daemon.request(command(4, QString::fromUtf8(policy))), resultOk);
        const QByteArray settings = setup.root.readFile(QStringLiteral("/etc/kest-iam.conf"));
        QVERIFY(
            settings.contains("[pw_strength]\nmin_length=8\nstrength=true\n") && settings.contains("cache_validity=3"));
        QVERIFY(settings.contains("enable=true"));
        QCOMPARE(setup.daemon.request(command(4, QStringLiteral(R"({"pw_strength":{}})"))),
            result("[PasswordConfig] : pw-config json missing field,[pw_strength pw_validity pw_history_check "
                   "first_login offline_login]"));
        QCOMPARE(setup.daemon.request(command(4, QStringLiteral("nope"))),
            result("[PasswordConfig] : pw-config json parse error!!!"));
        QCOMPARE(setup.daemon.request(command(9, 1)), result("invalid command!!!"));
        QCOMPARE(setup.daemon.call(QStringLiteral("modifyUser"), { QStringLiteral("[]") }),
            QByteArray(R"({"code":1,"data":null,"msg":"json解析失败"})"));
        QCOMPARE(setup.daemon.call(QStringLiteral("modifyUser"), { QStringLiteral(R"({"username":"@alice"})") }),
            QByteArray(R"({"code":2,"data":null,"msg":"json解析失败,缺少必要的字段"})"));
    }

    void commandLineAndLifecycle()
    {
        Setup setup;
        QVERIFY2(setup.start(), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        QCOMPARE(setup.lookUp(QStringLiteral("@alice")), passTrue);
        QByteArray out;
        QByteArray err;
        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--show-cache"), QStringLiteral("10001") }, &out, &err), 0);
        QCOMPARE(out,
            QByteArray(
                "uid: 10001\ngid: 10000\naccount: @alice\ndirectory: /home/alice\nshell: /bin/bash\ngecos: Alice\n"));
        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--show-cache"), QStringLiteral("10009") }, &out, &err), 1);
        QCOMPARE(out + err, QByteArray("read cache file failed!!!\n"));

        // A second daemon cannot listen and leaves the first one's pid file alone.
        const QByteArray pidFile = setup.root.readFile(QStringLiteral("/run/cache-kest.pid"));
        QProcess second;
        second.start(CacheDaemonFixture::programPath(), QStringList());
        QVERIFY(second.waitForFinished(15000));
        QCOMPARE(second.exitCode(), 1);
        QCOMPARE(setup.root.readFile(QStringLiteral("/run/cache-kest.pid")), pidFile);

        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--version") }, &out), 0);
        QCOMPARE(out, QByteArray("cache-kest 1.0\n"));
        QProcess notRoot;
        notRoot.start(QStringLiteral("setpriv"),
            { QStringLiteral("--reuid=65534"), QStringLiteral("--regid=65534"), QStringLiteral("--clear-groups"),
                CacheDaemonFixture::programPath() });
        QVERIFY(notRoot.waitForFinished(15000));
        QCOMPARE(notRoot.exitCode(), 2);

        QCOMPARE(setup.daemon.stop(), 0);
        QVERIFY(!QFile::exists(setup.root.filePath(QStringLiteral("/run/cache-kest.pid"))));
        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--clean-cache"), QStringLiteral("1") }, &out, &err), 1);
        QVERIFY(out.isEmpty() && !err.isEmpty());
    }
};

QTEST_GUILESS_MAIN(CacheDaemonTest)
#include "test_cachedaemon.moc"
