#include "cachestore.h"
#include "domainserverfixture.h"
#include "grouplistmanager.h"
#include "httphelper.h"
#include "messagehandler.h"
#include "syslogcapture.h"
#include "testroot.h"
#include "userlistmanager.h"

#include <QJsonArray>
#include <QTest>

namespace
{
const QString digest = UserListManager::passwordDigest(QStringLiteral("secret"));

// A domain server's user object; a gid other than 10000 comes without a group name.
QJsonObject user(const QString &name, uint uid, const QString &password = digest, const QStringList &permissions = {},
    uint gid = 10000)
{
    const QJsonObject group { { QStringLiteral("id"), double(gid) },
        { QStringLiteral("name"), gid == 10000 ? QStringLiteral("kest") : QString() } };
    return { { QStringLiteral("name"), name }, { QStringLiteral("uid"), double(uid) },
        { QStringLiteral("password"), password }, { QStringLiteral("primary_group"), group },
        { QStringLiteral("permissions"), QJsonArray::fromStringList(permissions) },
        { QStringLiteral("gecos"), QStringLiteral("G") } };
}

CacheControlPtr record(uint uid)
{
    CacheControlPtr loaded = createCacheControl();
    loaded->setUid(uid);
    return loadCacheRecord(loaded) ? loaded : CacheControlPtr();
}

bool writeRecord(uint uid, const char *account, int removeStatus = 0)
{
    CacheControlPtr entry = createCacheControl();
    return cacheRecordFromJson(entry,
               QStringLiteral(R"({"version":16777216,"uid":%1,"account":"%2","password":"%3","login_shell":"/bin/zsh",)"
                              R"("remove_status":%4})")
                   .arg(uid)
                   .arg(QLatin1String(account), digest)
                   .arg(removeStatus))
        && saveCacheRecord(*entry);
}
} // namespace

class UserListManagerTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase() { qInstallMessageHandler(messageHandler); }
    void init() { SyslogCapture::clear(); }

    void namesDecideTheFile_data()
    {
        QTest::addColumn<QString>("name");
        QTest::addColumn<bool>("special");
        QTest::newRow("one character") << QStringLiteral("a") << true;
        QTest::newRow("dot") << QStringLiteral("john.doe") << true;
        QTest::newRow("non-ASCII symbol") << QStringLiteral("a\u2603") << true;
        QTest::newRow("letters, at, dash") << QStringLiteral("al-ice@corp") << false;
        QTest::newRow("non-ASCII letters") << QStringLiteral("\u674e\u96f7") << false;
    }

    // Home and shell defaults ignore the home setting; special names go to the specials file only.
    void namesDecideTheFile()
    {
        QFETCH(QString, name);
        QFETCH(bool, special);
        TestRoot root;
        QVERIFY(root.writeSettings("[main]\nhome=/srv/remote\n"));
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(user(name, 10005, digest, { QStringLiteral("lp"), QStringLiteral("kest") }));
        const QByteArray line = (name + QLatin1Char(':') + digest + QStringLiteral(":10005:10000:G:/home/") + name
            + QStringLiteral(":/bin/bash\n"))
                                    .toUtf8();
        QCOMPARE(root.readFile(QStringLiteral("/var/lib/libkest-iam/specials.txt")), special ? line : QByteArray());
        QCOMPARE(SyslogCapture::count("invalid domain account name."), special ? 1 : 0);
        const CacheControlPtr saved = record(10005);
        QCOMPARE(saved.isNull(), special);
        if (!special) {
            QCOMPARE(saved->account() + saved->password() + saved->homePath(),
                name + digest + QStringLiteral("/home/") + name);
            QVERIFY(!(QFile::permissions(root.workDir() + QStringLiteral("/10005")) & QFileDevice::ReadOther));
        }
        QCOMPARE(groups.groupsOfUser(name), QStringList({ QStringLiteral("lp"), QStringLiteral("kest") }));
        QVERIFY(users.checkOfflinePassword(name, QStringLiteral("secret")));
        QVERIFY(!users.checkOfflinePassword(name, QStringLiteral("Secret")));
    }

    void updatesKeepWhatMatters()
    {
        TestRoot root;
        GroupListManager groups;
        UserListManager users(&groups);
        const QString alice = QStringLiteral("@alice");
        users.addUser(user(alice, 10001));
        const QByteArray before = root.readFile(QStringLiteral("/var/lib/libkest-iam/10001"));
        users.addUser(user(alice, 10002, digest, { QStringLiteral("sudo") }));
        QCOMPARE(SyslogCapture::matching("critical error: the same username has different UID. system refused login.")
                     .value(0, { 0, {} })
                     .priority,
            2);
        QCOMPARE(users.users().size(), 1);
        QCOMPARE(root.readFile(QStringLiteral("/var/lib/libkest-iam/10001")), before);
        QVERIFY(!record(10002) && !groups.groupsOfUser(alice).contains(QStringLiteral("sudo")));

        // A look-up carries "x": the digest and the last login survive it; a new gid without a name adds
        // the machine's group of that gid.
        users.recordLogin(alice);
        const quint64 login = record(10001)->lastLoginTime();
        QVERIFY(login > 0);
        users.addUser(user(alice, 10001, QStringLiteral("x"), {}, 100));
        QCOMPARE(record(10001)->password(), digest);
        QCOMPARE(record(10001)->lastLoginTime(), login);
        QVERIFY(groups.groupsOfUser(alice).contains(QStringLiteral("users")));

        // A new name for a listed uid is listed after it: the uid still finds the first entry.
        users.addUser(user(QStringLiteral("@alice2"), 10001));
        QCOMPARE(users.entryOfUid(10001)->name, alice);
        QCOMPARE(users.uidOfName(QStringLiteral("@alice2")), 10001u);
    }

    void loadsFromCache()
    {
        TestRoot root;
        QVERIFY(writeRecord(10001, "@alice") && writeRecord(10002, "@gone", 1) && writeRecord(10003, "@alice"));
        // A record of only the version reads back as uid 0 without a name: never listed.
        QVERIFY(root.writeFile(QStringLiteral("/var/lib/libkest-iam/10004"), QByteArray("\x00\x00\x00\x01", 4)));
        GroupListManager groups;
        UserListManager users(&groups);
        QCOMPARE(users.users().size(), 2);
        QCOMPARE(users.entryOfUid(10001)->shell, QStringLiteral("/bin/zsh"));
        QVERIFY(!users.hasUserName(QStringLiteral("@gone")) && !users.hasUid(10002));
        // Of two records of one name, the first listed answers.
        QCOMPARE(users.uidOfName(QStringLiteral("@alice")), users.users().first()->uid);
    }

    void rebuildAgainstTheDomainServer()
    {
        TestRoot root;
        DomainServerFixture server;
        QVERIFY2(server.isValid() && server.start(), qPrintable(server.errorText()));
        QVERIFY(root.writeSettings(server.settingsIni()));
        QVERIFY(writeRecord(10001, "@alice") && writeRecord(10099, "@ghost"));
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(user(QStringLiteral("a"), 10050));
        HttpHelper http;
        users.rebuildUsers(&http);
        QCOMPARE(SyslogCapture::matching("abnormal user, remove cache now. user: ").size(), 1);
        QCOMPARE(SyslogCapture::count("abnormal user, remove cache now. user: @ghost"), 1);
        QVERIFY(!record(10099) && !users.hasUserName(QStringLiteral("@ghost")));
        QCOMPARE(users.users().size(), 1);
        QCOMPARE(root.readFile(QStringLiteral("/var/lib/libkest-iam/specials.txt")), QByteArray());
        QCOMPARE(record(10001)->gecos(), QStringLiteral("Alice"));
        QVERIFY(users.checkOfflinePassword(QStringLiteral("@alice"), QStringLiteral("secret")));

        server.stop();
        users.rebuildUsers(&http);
        QCOMPARE(users.users().size(), 1);
        // A connection that ends without an answer is a lost server too, not a refusal.
        QVERIFY(server.start(server.port())
            && server.setMisbehaviour(QStringLiteral("/v3/account/"), QStringLiteral("close")));
        HttpHelper fresh;
        users.rebuildUsers(&fresh);
        QVERIFY(users.hasUserName(QStringLiteral("@alice")) && record(10001));
    }
};

QTEST_GUILESS_MAIN(UserListManagerTest)
#include "test_userlistmanager.moc"
