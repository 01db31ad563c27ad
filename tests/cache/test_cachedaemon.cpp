#include "cachecontrolfactory.h"
#include "cachedaemonfixture.h"
#include "cachestore.h"
#include "domainserverfixture.h"
#include "testroot.h"
#include "userlistmanager.h"

#include <QDateTime>
#include <QDir>
#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QTest>

#include <sys/stat.h>

namespace
{
const QByteArray passTrue = R"({"pass":true})";
const QByteArray passFalse = R"({"pass":false})";
const QByteArray resultOk = R"({"errorMessage":"","retVal":0})";

CacheControlPtr loadRecord(uint uid)
{
    CacheControlPtr record = createCacheControl();
    record->setUid(uid);
    if (!loadCacheRecord(record))
        return CacheControlPtr();
    return record;
}

QByteArray passwordRequest(const QString &user, const QString &newPassword, const QString &oldPassword)
{
    const QJsonObject request { { QStringLiteral("username"), user }, { QStringLiteral("password"), newPassword },
        { QStringLiteral("old_password"), oldPassword } };
    return QJsonDocument(request).toJson(QJsonDocument::Compact);
}

QByteArray commandRequest(int command, const QJsonValue &data)
{
    return QJsonDocument(QJsonObject { { QStringLiteral("command"), command }, { QStringLiteral("data"), data } })
        .toJson(QJsonDocument::Compact);
}

int codeOf(const QByteArray &reply)
{
    return QJsonDocument::fromJson(reply).object().value(QLatin1String("code")).toInt(-1);
}
} // namespace

// The real cache-kest against the test domain server, the way the machine's modules use it.
class CacheDaemonTest : public QObject
{
    Q_OBJECT

private:
    struct Setup {
        TestRoot root;
        DomainServerFixture server;
        CacheDaemonFixture daemon;
    };

    // A daemon in a fresh root beside a running domain server; offline login allowed for a day.
    static bool start(Setup &setup, const QVariantMap &settings = {})
    {
        if (!setup.server.isValid() || !setup.server.start())
            return false;
        QVariantMap values { { QStringLiteral("main/enable"), true }, { QStringLiteral("main/network-timeout"), 2 },
            { QStringLiteral("offline_login/enable"), true }, { QStringLiteral("offline_login/cache_validity"), 1 } };
        for (auto it = settings.cbegin(); it != settings.cend(); ++it)
            values.insert(it.key(), it.value());
        return setup.root.writeSettings(setup.server.settingsIni(values)) && setup.daemon.start();
    }

    static QByteArray lookUp(const Setup &setup, const QString &name)
    {
        return setup.daemon.call(QStringLiteral("queryAccountName"), { name });
    }

    static QByteArray login(const Setup &setup, const QString &name, const QString &password)
    {
        return setup.daemon.call(QStringLiteral("authenticatePassword"), { name, password });
    }

private Q_SLOTS:
    void lookUpsWriteTheLocalFiles()
    {
        Setup setup;
        QVERIFY2(start(setup), qPrintable(setup.server.errorText() + setup.daemon.errorText()));

        QCOMPARE(lookUp(setup, QStringLiteral("@nobody")), passFalse);
        setup.server.clearRequests();
        // Not a domain account name: answered without asking the server.
        QCOMPARE(lookUp(setup, QStringLiteral("root")), passFalse);
        QVERIFY(setup.server.requests().isEmpty());

        QCOMPARE(lookUp(setup, QStringLiteral("@alice")), passTrue);
        const CacheControlPtr alice = loadRecord(10001);
        QVERIFY(alice);
        QCOMPARE(alice->account(), QStringLiteral("@alice"));
        QCOMPARE(alice->password(), QStringLiteral("x"));
        QCOMPARE(alice->homePath(), QStringLiteral("/home/alice"));
        struct stat info;
        QCOMPARE(stat(QFile::encodeName(setup.root.filePath(QStringLiteral("/var/lib/libkest-iam/10001"))).constData(),
                     &info),
            0);
        QCOMPARE(info.st_mode & 0777, mode_t(0600));
        QVERIFY(QFile::exists(setup.root.filePath(QStringLiteral("/var/lib/libkest-iam/specials.txt"))));
        QVERIFY(setup.root.readFile(QStringLiteral("/var/lib/libkest-iam/groups.txt")).contains("@alice"));

        QCOMPARE(setup.daemon.call(QStringLiteral("queryUid"), { QStringLiteral("10002") }), passTrue);
        QCOMPARE(loadRecord(10002)->account(), QStringLiteral("@bob"));
        QCOMPARE(setup.daemon.call(QStringLiteral("queryUid"), { QStringLiteral("10077") }), passFalse);
        QVERIFY(!QFile::exists(setup.root.filePath(QStringLiteral("/var/lib/libkest-iam/10077"))));
    }

    void onlineThenOfflineLogin()
    {
        Setup setup;
        QVERIFY2(start(setup), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        const QString home = setup.root.filePath(QStringLiteral("/home/@alice"));
        QVERIFY(QDir().mkpath(home));
        QVERIFY(setup.root.writeFile(QStringLiteral("/home/@alice/notes"), "x"));

        QCOMPARE(login(setup, QStringLiteral("@alice"), QStringLiteral("wrong")), passFalse);
        QVERIFY(!QFile::exists(setup.root.filePath(QStringLiteral("/var/lib/libkest-iam/10001"))));
        QCOMPARE(login(setup, QStringLiteral("@alice"), QStringLiteral("alice-password")), passTrue);
        const CacheControlPtr alice = loadRecord(10001);
        QCOMPARE(alice->password(), UserListManager::passwordDigest(QStringLiteral("alice-password")));
        QVERIFY(alice->lastLoginTime() + 60 >= quint64(QDateTime::currentSecsSinceEpoch()));
        struct stat info;
        QCOMPARE(stat(QFile::encodeName(home).constData(), &info), 0);
        QCOMPARE(info.st_uid, uid_t(10001));
        QCOMPARE(info.st_gid, gid_t(10000));

        setup.server.stop();
        QCOMPARE(lookUp(setup, QStringLiteral("@alice")), passTrue);
        QCOMPARE(lookUp(setup, QStringLiteral("@bob")), passFalse);
        QCOMPARE(login(setup, QStringLiteral("@alice"), QStringLiteral("alice-password")), passTrue);
        QCOMPARE(login(setup, QStringLiteral("@alice"), QStringLiteral("wrong")), passFalse);
        QCOMPARE(login(setup, QStringLiteral("@bob"), QStringLiteral("bob-password")), passFalse);
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
        QVERIFY2(start(setup), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        QCOMPARE(login(setup, QStringLiteral("@alice"), QStringLiteral("alice-password")), passTrue);
        setup.server.stop();

        CacheControlPtr alice = loadRecord(10001);
        QVERIFY(alice);
        alice->setLastLoginTime(quint64(QDateTime::currentSecsSinceEpoch() - lastLoginAgo));
        alice->setRemoveStatus(removeStatus);
        QVERIFY(saveCacheRecord(*alice));
        QVERIFY(setup.root.writeSettings(setup.server.settingsIni(
            { { QStringLiteral("main/enable"), true }, { QStringLiteral("offline_login/enable"), enabled },
                { QStringLiteral("offline_login/cache_validity"), validityDays } })));

        QCOMPARE(login(setup, QStringLiteral("@alice"), QStringLiteral("alice-password")), expected);
        // "x" marks shadowed passwords and is refused before anything else.
        QCOMPARE(login(setup, QStringLiteral("@alice"), QStringLiteral("x")), passFalse);
    }

    void garbageFromTheServerWritesNothing_data()
    {
        QTest::addColumn<QString>("misbehaviour");
        QTest::addColumn<QJsonObject>("data");
        QTest::newRow("not JSON") << QStringLiteral("not-json") << QJsonObject();
        QTest::newRow("no msg") << QStringLiteral("no-msg") << QJsonObject();
        QTest::newRow("too slow") << QStringLiteral("delay:4000") << QJsonObject();
        QTest::newRow("closes the connection") << QStringLiteral("close") << QJsonObject();
        QJsonObject lowUid = DomainServerFixture::defaultData();
        QJsonArray users = lowUid.value(QLatin1String("users")).toArray();
        QJsonObject alice = users.at(0).toObject();
        alice.insert(QStringLiteral("uid"), 9999);
        users.replace(0, alice);
        lowUid.insert(QStringLiteral("users"), users);
        QTest::newRow("uid below 10000") << QString() << lowUid;
    }

    void garbageFromTheServerWritesNothing()
    {
        QFETCH(QString, misbehaviour);
        QFETCH(QJsonObject, data);
        Setup setup;
        QVERIFY2(start(setup), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        if (!misbehaviour.isEmpty())
            QVERIFY(setup.server.setMisbehaviour(QStringLiteral("/v3/account/"), misbehaviour));
        if (!data.isEmpty())
            QVERIFY(setup.server.setData(data));

        QCOMPARE(lookUp(setup, QStringLiteral("@alice")), passFalse);
        QCOMPARE(login(setup, QStringLiteral("@alice"), QStringLiteral("alice-password")), passFalse);
        const QStringList files = QDir(setup.root.workDir()).entryList(QDir::Files);
        QVERIFY2(files.isEmpty() || files == QStringList { QStringLiteral("groups.txt") },
            qPrintable(files.join(QLatin1Char(' '))));
    }

    void refreshOnceTheServerIsBack()
    {
        Setup setup;
        QVERIFY(setup.server.isValid());
        QVERIFY(setup.server.start());
        const quint16 port = setup.server.port();
        setup.server.stop();
        QVERIFY(setup.root.writeSettings(setup.server.settingsIni({ { QStringLiteral("main/enable"), true } })));
        CacheControlPtr record = createCacheControl();
        QVERIFY(cacheRecordFromJson(
            record, QStringLiteral(R"({"version":16777216,"uid":10001,"account":"@alice","gecos":"old"})")));
        QVERIFY(saveCacheRecord(*record));
        QVERIFY(cacheRecordFromJson(record, QStringLiteral(R"({"version":16777216,"uid":10099,"account":"@ghost"})")));
        QVERIFY(saveCacheRecord(*record));

        QVERIFY2(setup.daemon.start(), qPrintable(setup.daemon.errorText()));
        QTest::qWait(1500);
        QVERIFY(QFile::exists(setup.root.filePath(QStringLiteral("/var/lib/libkest-iam/10099"))));
        QVERIFY(setup.server.start(port));
        QTRY_VERIFY_WITH_TIMEOUT(
            !QFile::exists(setup.root.filePath(QStringLiteral("/var/lib/libkest-iam/10099"))), 15000);
        QTRY_COMPARE_WITH_TIMEOUT(loadRecord(10001)->gecos(), QStringLiteral("Alice"), 15000);
    }

    void passwordChange_data()
    {
        QTest::addColumn<QByteArray>("argument");
        QTest::addColumn<bool>("serverUp");
        QTest::addColumn<QByteArray>("expected"); // the reply, or "code:N" for the server's own answer

        QTest::newRow("changed") << passwordRequest(
            QStringLiteral("@alice"), QStringLiteral("new-pass"), QStringLiteral("alice-password"))
                                 << true << QByteArray("code:0");
        QTest::newRow("wrong old password") << passwordRequest(QStringLiteral("@alice"), QStringLiteral("new-pass"),
            QStringLiteral("guess")) << true << QByteArray("code:1");
        QTest::newRow("not JSON") << QByteArray("{username") << true
                                  << QByteArray(R"({"code":1,"data":null,"msg":"json格式解析错误"})");
        QTest::newRow("missing field")
            << QByteArray(R"({"username":"@alice","password":"p"})") << true
            << QByteArray(R"({"code":2,"data":null,"msg":"请求消息缺少必要的字段,username,password,old_password"})");
        QTest::newRow("local account") << passwordRequest(QStringLiteral("root"), QStringLiteral("a"),
            QStringLiteral(
                "b")) << true << QByteArray(R"({"code":3,"data":null,"msg":"校验域账号失败,不能查询到此账户信息"})");
        QTest::newRow("server down") << passwordRequest(
            QStringLiteral("@alice"), QStringLiteral("new-pass"), QStringLiteral("alice-password"))
                                     << false << QByteArray(R"({"code":4,"data":null,"msg":"网络错误,无法修改密码"})");
    }

    void passwordChange()
    {
        QFETCH(QByteArray, argument);
        QFETCH(bool, serverUp);
        QFETCH(QByteArray, expected);
        Setup setup;
        QVERIFY2(start(setup), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        QCOMPARE(login(setup, QStringLiteral("@alice"), QStringLiteral("alice-password")), passTrue);
        if (!serverUp)
            setup.server.stop();

        QByteArray out;
        QByteArray err;
        QCOMPARE(
            setup.daemon.runClient({ QStringLiteral("--modify-user-passwd"), QString::fromUtf8(argument) }, &out, &err),
            0);
        QVERIFY2(out.endsWith('\n'), out.constData());
        const QByteArray reply = out.trimmed();
        if (expected.startsWith("code:"))
            QCOMPARE(codeOf(reply), expected.mid(5).toInt());
        else
            QCOMPARE(reply, expected);

        if (expected == "code:0") {
            const QString digest = UserListManager::passwordDigest(QStringLiteral("new-pass"));
            QCOMPARE(loadRecord(10001)->password(), digest);
            QCOMPARE(login(setup, QStringLiteral("@alice"), QStringLiteral("new-pass")), passTrue);
        } else {
            QCOMPARE(loadRecord(10001)->password(), UserListManager::passwordDigest(QStringLiteral("alice-password")));
        }
    }

    void modifyUserFunctionCall()
    {
        Setup setup;
        QVERIFY2(start(setup), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        QCOMPARE(setup.daemon.call(QStringLiteral("modifyUser"), { QStringLiteral("[]") }),
            QByteArray(R"({"code":1,"data":null,"msg":"json解析失败"})"));
        QCOMPARE(setup.daemon.call(QStringLiteral("modifyUser"), { QStringLiteral(R"({"username":"@alice"})") }),
            QByteArray(R"({"code":2,"data":null,"msg":"json解析失败,缺少必要的字段"})"));
    }

    void serverCommands()
    {
        Setup setup;
        QVERIFY2(start(setup), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        QCOMPARE(lookUp(setup, QStringLiteral("@alice")), passTrue);
        QCOMPARE(lookUp(setup, QStringLiteral("@bob")), passTrue);
        const auto exists = [&setup](uint uid) {
            return QFile::exists(setup.root.filePath(QStringLiteral("/var/lib/libkest-iam/") + QString::number(uid)));
        };
        QByteArray out;

        // Through the command line: every argument travels as a JSON string.
        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--update-cache"), QStringLiteral("10001") }, &out), 0);
        QCOMPARE(out, QByteArray(R"({"errorMessage":"[UpdateCache] : cache file not exists!!!","retVal":1})") + '\n');
        QCOMPARE(setup.daemon.request(commandRequest(3, 10001)), resultOk);
        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--clean-cache"), QStringLiteral("10002") }, &out), 0);
        QCOMPARE(out, resultOk + '\n');
        QVERIFY(!exists(10002));
        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--clean-cache"), QStringLiteral("10002") }, &out), 0);
        QCOMPARE(out, QByteArray(R"({"errorMessage":"[CleanCache] : cache file not exists!!!","retVal":1})") + '\n');
        QCOMPARE(setup.daemon.request(commandRequest(1, 10001)),
            QByteArray(R"({"errorMessage":"[CleanCache] : cache file not exists!!!","retVal":1})"));

        QCOMPARE(lookUp(setup, QStringLiteral("@bob")), passTrue);
        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--clean-cache-not-in-list"),
                                            QStringLiteral(R"({"whitelist":[10001,"10002"]})") },
                     &out),
            0);
        QCOMPARE(out, resultOk + '\n');
        QVERIFY(exists(10001));
        QVERIFY(!exists(10002));
        QCOMPARE(setup.daemon.request(commandRequest(2, QStringLiteral("{"))),
            QByteArray(R"({"errorMessage":"[CleanCacheNotInList] : json parse error!!!","retVal":1})"));

        const QByteArray policy
            = R"({"pw_strength":{"min_length":8,"strength":1},"pw_validity":{},"pw_history_check":{"enable":true},"first_login":{},"offline_login":{"cache_validity":3}})";
        QCOMPARE(setup.daemon.request(commandRequest(4, QString::fromUtf8(policy))), resultOk);
        const QByteArray settings = setup.root.readFile(QStringLiteral("/etc/kest-iam.conf"));
        QVERIFY(settings.contains("[pw_strength]\nmin_length=8\nstrength=true\n"));
        QVERIFY(settings.contains("cache_validity=3"));
        QVERIFY(settings.contains("enable=true")); // the daemon's own switch is kept
        QCOMPARE(setup.daemon.request(commandRequest(4, QStringLiteral(R"({"pw_strength":{}})"))),
            QByteArray(
                R"({"errorMessage":"[PasswordConfig] : pw-config json missing field,[pw_strength pw_validity pw_history_check first_login offline_login]","retVal":1})"));
        QCOMPARE(setup.daemon.request(commandRequest(4, QStringLiteral("nope"))),
            QByteArray(R"({"errorMessage":"[PasswordConfig] : pw-config json parse error!!!","retVal":1})"));
        QCOMPARE(setup.daemon.request(commandRequest(9, 1)),
            QByteArray(R"({"errorMessage":"invalid command!!!","retVal":1})"));
    }

    void commandLine()
    {
        Setup setup;
        QVERIFY2(start(setup), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        QCOMPARE(lookUp(setup, QStringLiteral("@alice")), passTrue);
        QByteArray out;
        QByteArray err;
        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--show-cache"), QStringLiteral("10001") }, &out, &err), 0);
        QCOMPARE(out,
            QByteArray(
                "uid: 10001\ngid: 10000\naccount: @alice\ndirectory: /home/alice\nshell: /bin/bash\ngecos: Alice\n"));
        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--show-cache"), QStringLiteral("10009") }, &out, &err), 1);
        QVERIFY(out.isEmpty());
        QCOMPARE(err, QByteArray("read cache file failed!!!\n"));

        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--version") }, &out), 0);
        QVERIFY(out.contains("1.0"));
        QCOMPARE(setup.daemon.stop(), 0);
        QVERIFY(!QFile::exists(setup.root.filePath(QStringLiteral("/run/cache-kest.pid"))));
        // Nobody listening any more.
        QCOMPARE(setup.daemon.runClient({ QStringLiteral("--clean-cache"), QStringLiteral("1") }, &out, &err), 1);
        QVERIFY(out.isEmpty());
        QVERIFY(!err.isEmpty());
    }

    void secondInstanceLeavesTheFirstAlone()
    {
        Setup setup;
        QVERIFY2(start(setup), qPrintable(setup.server.errorText() + setup.daemon.errorText()));
        const QByteArray pidFile = setup.root.readFile(QStringLiteral("/run/cache-kest.pid"));
        QProcess second;
        second.start(CacheDaemonFixture::programPath(), QStringList());
        QVERIFY(second.waitForFinished(15000));
        QCOMPARE(second.exitCode(), 1);
        QCOMPARE(setup.root.readFile(QStringLiteral("/run/cache-kest.pid")), pidFile);
        QCOMPARE(lookUp(setup, QStringLiteral("@alice")), passTrue);
    }
};

QTEST_GUILESS_MAIN(CacheDaemonTest)
#include "test_cachedaemon.moc"
