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
const QString alice = QStringLiteral("@alice");

// A domain server's user object; a gid other than 10000 comes without a group name.
QJsonObject user(const QString &name, uint uid, const QString &password = digest, const QStringList &permissions = {},
    uint gid = 10000)
{
    const QJsonObject group { { QStringLiteral("id"), double(gid) },
        { QStringLiteral("name"), gid == 10000 ? QStringLiteral("kest") : QString() } };
    return { { QStringLiteral("name"), name }, { QStringLiteral("uid"), double(uid) },
        { QStringLiteral("password"), password }, { QStringLiteral("primary_group"), group },
        { QStringLiteral("permissions"), QJsonArray::fromStringList(permissions) } };
}

// A record as an earlier run of the daemon left it.
bool writeRecord(uint uid, const char *account, int removeStatus = 0)
{
    CacheControlPtr entry = createCacheControl();
    const QString json = QStringLiteral(R"({"version":16777216,"uid":%1,"account":"%2","password":"%3",)"
                                        R"("login_shell":"/bin/zsh","remove_status":%4})");
    return cacheRecordFromJson(entry, json.arg(uid).arg(QLatin1String(account), digest).arg(removeStatus))
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
        const QStringList permissions { QStringLiteral("lp"), QStringLiteral("kest") };
        users.addUser(user(name, 10005, digest, permissions));
        const QString home = QStringLiteral("/home/") + name;
        const QString line = QStringLiteral("%1:%2:10005:10000::%3:/bin/bash\n").arg(name, digest, home);
        QCOMPARE(root.readFile(QStringLiteral("/var/lib/libkest-iam/specials.txt")), special ? line.toUtf8() : "");
        const CacheControlPtr saved = readCacheRecord(10005);
        QCOMPARE(saved ? saved->account() + saved->password() + saved->homePath() : QString(),
            special ? QString() : name + digest + home);
        QCOMPARE(groups.groupsOfUser(name), permissions);
        QVERIFY(users.checkOfflinePassword(name, QStringLiteral("secret"))
            && !users.checkOfflinePassword(name, QStringLiteral("Secret")));
    }

    void updatesKeepWhatMatters()
    {
        TestRoot root;
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(user(alice, 10001));
        users.addUser(user(alice, 10002, digest, { QStringLiteral("sudo") }));
        QCOMPARE(SyslogCapture::matching("system refused login.").value(0).priority, 2); // another uid for the name
        QVERIFY(!readCacheRecord(10002) && !groups.groupsOfUser(alice).contains(QStringLiteral("sudo")));

        // A look-up's "x" keeps the digest and the last login; a new gid without a name adds the machine's group.
        users.recordLogin(alice);
        const quint64 login = readCacheRecord(10001)->lastLoginTime();
        users.addUser(user(alice, 10001, QStringLiteral("x"), {}, 100));
        QVERIFY(readCacheRecord(10001)->password() == digest && readCacheRecord(10001)->lastLoginTime() == login);
        QVERIFY(groups.groupsOfUser(alice).contains(QStringLiteral("users")));

        users.addUser(user(QStringLiteral("@alice2"), 10001)); // listed after alice: the uid still finds her
        QVERIFY(users.entryOfUid(10001)->name == alice && users.uidOfName(QStringLiteral("@alice2")) == 10001u);
    }

    // Records marked for removal or of only the version (uid 0, no name) are never listed; of two of one name the
    // first listed answers. The rebuild refreshes alice, keeps her digest, disowns the ghost, skips the special name.
    void loadAndRebuild()
    {
        TestRoot root;
        DomainServerFixture server;
        QVERIFY2(server.isValid() && server.start() && root.writeSettings(server.settingsIni()),
            qPrintable(server.errorText()));
        QVERIFY(writeRecord(10001, "@alice") && writeRecord(10002, "@gone", 1) && writeRecord(10003, "@alice"));
        QVERIFY(root.writeFile(QStringLiteral("/var/lib/libkest-iam/10004"), QByteArray("\x00\x00\x00\x01", 4)));
        GroupListManager groups;
        UserListManager users(&groups);
        QVERIFY(users.hasUid(10001) && users.hasUid(10003) && users.users().size() == 2);
        QCOMPARE(users.entryOfUid(10001)->shell, QStringLiteral("/bin/zsh"));
        QCOMPARE(users.uidOfName(alice), users.users().first()->uid);

        users.addUser(user(QStringLiteral("a"), 10050));
        users.addUser(user(QStringLiteral("@ghost"), 10099));
        HttpHelper http;
        users.rebuildUsers(&http);
        QVERIFY(!readCacheRecord(10099) && users.users().size() == 1);
        QCOMPARE(root.readFile(QStringLiteral("/var/lib/libkest-iam/specials.txt")), QByteArray());
        QCOMPARE(readCacheRecord(10001)->gecos(), QStringLiteral("Alice"));
        QVERIFY(users.checkOfflinePassword(alice, QStringLiteral("secret")));

        QVERIFY(server.setMisbehaviour(QStringLiteral("/v3/account/"), QStringLiteral("close")));
        users.rebuildUsers(&http); // a connection that ends without an answer is a lost server, not a refusal
        QVERIFY(users.hasUserName(alice) && readCacheRecord(10001));
    }
};

QTEST_GUILESS_MAIN(UserListManagerTest)
#include "test_userlistmanager.moc"
