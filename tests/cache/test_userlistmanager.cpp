#include "cachecontrolfactory.h"
#include "cachestore.h"
#include "domainserverfixture.h"
#include "grouplistmanager.h"
#include "httphelper.h"
#include "messagehandler.h"
#include "syslogcapture.h"
#include "testroot.h"
#include "userlistmanager.h"

#include <QDir>
#include <QFile>
#include <QJsonArray>
#include <QTest>

namespace
{
const QString specialsFile = QStringLiteral("/var/lib/libkest-iam/specials.txt");
const QString groupsFile = QStringLiteral("/var/lib/libkest-iam/groups.txt");
const QString aliceDigest = UserListManager::passwordDigest(QStringLiteral("secret"));

QJsonObject userObject(const QString &name, uint uid, const QString &password = QStringLiteral("x"),
    const QStringList &permissions = {}, uint gid = 10000, const QString &primaryGroup = QStringLiteral("kest"))
{
    return QJsonObject { { QStringLiteral("name"), name }, { QStringLiteral("uid"), double(uid) },
        { QStringLiteral("password"), password },
        { QStringLiteral("primary_group"),
            QJsonObject { { QStringLiteral("id"), double(gid) }, { QStringLiteral("name"), primaryGroup } } },
        { QStringLiteral("permissions"), QJsonArray::fromStringList(permissions) },
        { QStringLiteral("gecos"), name + QStringLiteral(" Example") } };
}

CacheControlPtr record(uint uid)
{
    CacheControlPtr loaded = createCacheControl();
    loaded->setUid(uid);
    if (!loadCacheRecord(loaded))
        return CacheControlPtr();
    return loaded;
}

bool writeRecord(uint uid, const QString &account, quint32 removeStatus = 0)
{
    CacheControlPtr entry = createCacheControl();
    entry->setVersion(kCacheVersion1_0);
    entry->setUid(uid);
    entry->setAccount(account);
    entry->setMainGid(10000);
    entry->setPassword(aliceDigest);
    entry->setHomePath(QStringLiteral("/home/") + account);
    entry->setLoginShell(QStringLiteral("/bin/zsh"));
    entry->setRemoveStatus(removeStatus);
    return saveCacheRecord(*entry);
}

QStringList membersOf(const QByteArray &groups, const QByteArray &group)
{
    const QList<QByteArray> lines = groups.split('\n');
    for (const QByteArray &line : lines) {
        if (line.startsWith(group + ':'))
            return QString::fromUtf8(line.mid(line.lastIndexOf(':') + 1)).split(QLatin1Char(','), Qt::SkipEmptyParts);
    }
    return QStringList();
}
} // namespace

class UserListManagerTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase() { qInstallMessageHandler(messageHandler); }
    void init() { SyslogCapture::clear(); }

    void defaultsAndRecord()
    {
        TestRoot root;
        QVERIFY(root.writeSettings("[main]\nhome=/srv/remote\n"));
        GroupListManager groups;
        UserListManager users(&groups);
        QJsonObject user = userObject(QStringLiteral("@alice"), 10001, aliceDigest, { QStringLiteral("lp") });
        user.insert(QStringLiteral("home"), QString());
        users.addUser(user);

        const UserEntryPtr entry = users.entryOfUid(10001);
        QVERIFY(entry);
        QCOMPARE(entry->home, QStringLiteral("/home/@alice"));
        QCOMPARE(entry->shell, QStringLiteral("/bin/bash"));

        const CacheControlPtr saved = record(10001);
        QVERIFY(saved);
        QCOMPARE(saved->account(), QStringLiteral("@alice"));
        QCOMPARE(saved->password(), aliceDigest);
        QCOMPARE(saved->mainGid(), 10000u);
        QCOMPARE(saved->homePath(), QStringLiteral("/home/@alice"));
        QCOMPARE(saved->loginShell(), QStringLiteral("/bin/bash"));
        QCOMPARE(saved->gecos(), QStringLiteral("@alice Example"));
        QCOMPARE(QFile::permissions(root.filePath(QStringLiteral("/var/lib/libkest-iam/10001")))
                & (QFileDevice::ReadOther | QFileDevice::ReadGroup),
            QFileDevice::Permissions());

        const QByteArray groupFile = root.readFile(groupsFile);
        QCOMPARE(membersOf(groupFile, "lp"), QStringList { QStringLiteral("@alice") });
        QCOMPARE(membersOf(groupFile, "kest"), QStringList { QStringLiteral("@alice") });
        QVERIFY(users.checkOfflinePassword(QStringLiteral("@alice"), QStringLiteral("secret")));
        QVERIFY(!users.checkOfflinePassword(QStringLiteral("@alice"), QStringLiteral("Secret")));
        QVERIFY(!users.checkOfflinePassword(QStringLiteral("@bob"), QStringLiteral("secret")));
    }

    void namesDecideTheFile_data()
    {
        QTest::addColumn<QString>("name");
        QTest::addColumn<bool>("special");
        QTest::newRow("one character") << QStringLiteral("a") << true;
        QTest::newRow("dot") << QStringLiteral("john.doe") << true;
        QTest::newRow("blank") << QStringLiteral("john doe") << true;
        QTest::newRow("colon") << QStringLiteral("ev:il") << true;
        QTest::newRow("domain form") << QStringLiteral("@alice") << false;
        QTest::newRow("letters and at") << QStringLiteral("alice@corp") << false;
        QTest::newRow("dash and underscore") << QStringLiteral("a-b_c") << false;
        QTest::newRow("non-ASCII letters") << QStringLiteral("\u674e\u96f7") << false;
        QTest::newRow("non-ASCII symbol") << QStringLiteral("a\u2603") << true;
    }

    void namesDecideTheFile()
    {
        QFETCH(QString, name);
        QFETCH(bool, special);
        TestRoot root;
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(userObject(name, 10005));

        const QByteArray specials = root.readFile(specialsFile);
        const QByteArray expectedLine
            = name.toUtf8() + ":x:10005:10000:" + name.toUtf8() + " Example:/home/" + name.toUtf8() + ":/bin/bash\n";
        QCOMPARE(specials, special ? expectedLine : QByteArray());
        QCOMPARE(QFile::exists(root.filePath(QStringLiteral("/var/lib/libkest-iam/10005"))), !special);
        QCOMPARE(SyslogCapture::count("invalid domain account name."), special ? 1 : 0);
        QCOMPARE(UserListManager::isValidDomainAccountName(name), !special);
    }

    void sameNameOtherUidChangesNothing()
    {
        TestRoot root;
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(userObject(QStringLiteral("@alice"), 10001, aliceDigest));
        const QByteArray groupsBefore = root.readFile(groupsFile);
        const QByteArray recordBefore = root.readFile(QStringLiteral("/var/lib/libkest-iam/10001"));

        users.addUser(userObject(QStringLiteral("@alice"), 10002, aliceDigest, { QStringLiteral("sudo") }));
        const QList<SyslogLine> critical
            = SyslogCapture::matching("critical error: the same username has different UID. system refused login.");
        QCOMPARE(critical.size(), 1);
        QCOMPARE(critical.first().priority, 2);
        QCOMPARE(users.users().size(), 1);
        QCOMPARE(users.uidOfName(QStringLiteral("@alice")), 10001u);
        QCOMPARE(root.readFile(groupsFile), groupsBefore);
        QCOMPARE(root.readFile(QStringLiteral("/var/lib/libkest-iam/10001")), recordBefore);
        QVERIFY(!QFile::exists(root.filePath(QStringLiteral("/var/lib/libkest-iam/10002"))));
    }

    void primaryGroupListedOnce()
    {
        TestRoot root;
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(
            userObject(QStringLiteral("@bob"), 10003, aliceDigest, { QStringLiteral("kest"), QStringLiteral("lp") }));
        users.addUser(
            userObject(QStringLiteral("@bob"), 10003, aliceDigest, { QStringLiteral("kest"), QStringLiteral("lp") }));
        const QByteArray groupFile = root.readFile(groupsFile);
        QCOMPARE(membersOf(groupFile, "kest"), QStringList { QStringLiteral("@bob") });
        QCOMPARE(
            groups.groupsOfUser(QStringLiteral("@bob")), QStringList({ QStringLiteral("lp"), QStringLiteral("kest") }));
    }

    void otherGidAddsTheMachinesGroup()
    {
        TestRoot root;
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(userObject(QStringLiteral("@carol"), 10004));
        // Same user, now with the machine's gid 100 ("users") as primary group but no name for it.
        users.addUser(userObject(QStringLiteral("@carol"), 10004, QStringLiteral("x"), {}, 100, QString()));
        QVERIFY(groups.groupsOfUser(QStringLiteral("@carol")).contains(QStringLiteral("users")));
        QCOMPARE(users.entryOfUid(10004)->gid, 100u);
    }

    void lookupKeepsTheDigest()
    {
        TestRoot root;
        {
            GroupListManager groups;
            UserListManager users(&groups);
            users.addUser(userObject(QStringLiteral("@alice"), 10001, aliceDigest));
            users.addUser(userObject(QStringLiteral("@alice"), 10001, QStringLiteral("x")));
            QVERIFY(users.checkOfflinePassword(QStringLiteral("@alice"), QStringLiteral("secret")));
        }
        // A restarted daemon knows the user from the record; a look-up must not wipe it there either.
        GroupListManager groups;
        UserListManager users(&groups);
        users.clearUsers();
        users.addUser(userObject(QStringLiteral("@alice"), 10001, QStringLiteral("x")));
        QCOMPARE(record(10001)->password(), aliceDigest);
        QVERIFY(users.checkOfflinePassword(QStringLiteral("@alice"), QStringLiteral("secret")));
    }

    void loadsFromCache()
    {
        TestRoot root;
        QVERIFY(writeRecord(10001, QStringLiteral("@alice")));
        QVERIFY(writeRecord(10002, QStringLiteral("@gone"), 1));
        QVERIFY(writeRecord(10003, QStringLiteral("@carol")));
        // A record of only the version reads back as uid 0 without a name: it must never be listed.
        QVERIFY(root.writeFile(QStringLiteral("/var/lib/libkest-iam/10004"), QByteArray("\x00\x00\x00\x01", 4)));

        GroupListManager groups;
        UserListManager users(&groups);
        QStringList names;
        for (const UserEntryPtr &entry : users.users())
            names.append(entry->name);
        names.sort();
        QCOMPARE(names, QStringList({ QStringLiteral("@alice"), QStringLiteral("@carol") }));
        const UserEntryPtr alice = users.entryOfUid(10001);
        QCOMPARE(alice->shell, QStringLiteral("/bin/zsh"));
        QCOMPARE(alice->password, aliceDigest);
        QVERIFY(!users.hasUid(10002));
        QVERIFY(!users.hasUid(0));
        // Nothing is written back by loading.
        QVERIFY(!QFile::exists(root.filePath(specialsFile)));
    }

    void recordLoginStampsTheRecord()
    {
        TestRoot root;
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(userObject(QStringLiteral("@alice"), 10001, aliceDigest));
        QCOMPARE(record(10001)->lastLoginTime(), quint64(0));
        const quint64 before = quint64(QDateTime::currentSecsSinceEpoch());
        users.recordLogin(QStringLiteral("@alice"));
        QVERIFY(record(10001)->lastLoginTime() >= before);
        // A later refresh of the account keeps the time of the last login.
        users.addUser(userObject(QStringLiteral("@alice"), 10001, QStringLiteral("x")));
        QVERIFY(record(10001)->lastLoginTime() >= before);
    }

    void rebuildAgainstTheDomainServer()
    {
        TestRoot root;
        DomainServerFixture server;
        QVERIFY2(server.isValid() && server.start(), qPrintable(server.errorText()));
        QVERIFY(root.writeSettings(server.settingsIni({ { QStringLiteral("main/network-timeout"), 2 } })));
        QVERIFY(writeRecord(10001, QStringLiteral("@alice")));
        QVERIFY(writeRecord(10099, QStringLiteral("@ghost")));
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(userObject(QStringLiteral("a"), 10050));
        QCOMPARE(users.users().size(), 3);
        HttpHelper http;

        SyslogCapture::clear();
        users.rebuildUsers(&http);
        QCOMPARE(SyslogCapture::count("abnormal user, remove cache now. user: @ghost"), 1);
        QCOMPARE(SyslogCapture::count("abnormal user, remove cache now. user: "), 1);
        QVERIFY(!QFile::exists(root.filePath(QStringLiteral("/var/lib/libkest-iam/10099"))));
        QCOMPARE(users.users().size(), 1);
        const UserEntryPtr alice = users.entryOfUid(10001);
        QVERIFY(alice);
        QCOMPARE(alice->gecos, QStringLiteral("Alice"));
        QCOMPARE(record(10001)->gecos(), QStringLiteral("Alice"));
        // The digest of the last login survives the refresh.
        QVERIFY(users.checkOfflinePassword(QStringLiteral("@alice"), QStringLiteral("secret")));

        server.stop();
        users.rebuildUsers(&http);
        QCOMPARE(users.users().size(), 1);
        QVERIFY(record(10001));
    }

    void unwritableSpecials()
    {
        TestRoot root;
        QVERIFY(QDir().mkpath(root.filePath(specialsFile)));
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(userObject(QStringLiteral("@alice"), 10001, aliceDigest));
        QCOMPARE(SyslogCapture::count("open specials file failed. "), 1);
        QVERIFY(record(10001));
    }
};

QTEST_GUILESS_MAIN(UserListManagerTest)
#include "test_userlistmanager.moc"
