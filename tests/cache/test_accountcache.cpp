#include "cachestore.h"
#include "compactjson.h"
#include "domainserverfixture.h"
#include "grouplistmanager.h"
#include "homedirectoryrepair.h"
#include "httphelper.h"
#include "localconnection.h"
#include "messagehandler.h"
#include "offlinelogin.h"
#include "syslogcapture.h"
#include "testroot.h"
#include "userlistmanager.h"

#include <QDateTime>
#include <QDir>
#include <QJsonArray>
#include <QJsonObject>
#include <QTest>
#include <QThread>

#include <atomic>
#include <dirent.h>
#include <grp.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

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

const QString groupsFile = QStringLiteral("/var/lib/libkest-iam/groups.txt");

// The group's line in the groups file; empty when there is none.
QByteArray lineOf(const TestRoot &root, const QByteArray &group)
{
    const QByteArray file = root.readFile(groupsFile);
    const int at = ('\n' + file).indexOf('\n' + group + ':');
    return at < 0 ? QByteArray() : file.mid(at, file.indexOf('\n', at) - at);
}

struct stat statOf(const QString &path)
{
    struct stat info = {};
    stat(QFile::encodeName(path).constData(), &info);
    return info;
}
// The names of a directory in the order the file system lists them.
QStringList listed(const QString &path)
{
    QStringList names;
    DIR *directory = opendir(QFile::encodeName(path).constData());
    while (const dirent *entry = directory ? readdir(directory) : nullptr) {
        if (entry->d_name[0] != '.')
            names << QFile::decodeName(entry->d_name);
    }
    if (directory)
        closedir(directory);
    return names;
}
} // namespace

// Largest heap request while probing (-1: not probing): an announced string length must never become one
// allocation. The sanitizer build owns malloc itself, so there nothing is recorded.
static std::atomic<long long> largest { -1 };
#if !defined(__SANITIZE_ADDRESS__)
extern "C" void *__libc_malloc(size_t size);
extern "C" void *malloc(size_t size) noexcept
{
    if (largest >= 0 && static_cast<long long>(size) > largest)
        largest = static_cast<long long>(size);
    return __libc_malloc(size);
}
#endif

// Cache records and their store, then the user list, the group list and the home repair that drive them.
class AccountCacheTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase() { qInstallMessageHandler(messageHandler); }
    void init()
    {
        QVERIFY(m_root.isValid() && QDir(m_root.workDir()).removeRecursively() && QDir().mkpath(m_root.workDir()));
        SyslogCapture::clear();
    }

    // A record read from a file with a stale encrypted zone goes back without it, over a longer world-writable file:
    // the bytes built here, owner-only. A record without a version is not written.
    void forms()
    {
        const QByteArray zoned = recordFile(10001, "@alice", 0, 1700000000, "cipher");
        QVERIFY(put("10001", le(kCacheVersion1_0, 4) + le(6, 4) + le(9, 4) + zoned.mid(12)));
        CacheControlPtr record = createCacheControl();
        record->readFromFile(at("10001"));
        QVERIFY(put("10001", QByteArray(4096, 'z')) && QFile::setPermissions(at("10001"), QFile::Permissions(0x6666)));
        QVERIFY(saveCacheRecord(*record));
        QCOMPARE(m_root.readFile(kDir + QLatin1String("10001")).toHex(), recordFile().toHex());
        QCOMPARE(QFile::permissions(at("10001")), QFile::Permissions(0x6600));
        QVERIFY(!createCacheControl()->writeToFile(at("unversioned")) && !QFile::exists(at("unversioned")));

        // Through its JSON form, where a uid beyond 2^31 is a negative number; with count 2 and three names the file
        // takes two. Each refusal warns and leaves the record as it was.
        QJsonObject json = QJsonDocument::fromJson(record->toJsonString(QJsonDocument::Compact).toUtf8()).object();
        json.insert(QStringLiteral("uid"), -294967296);
        json.insert(QStringLiteral("remove_status"), 3);
        json.insert(QStringLiteral("function_group_list"),
            QJsonArray { QStringLiteral("dev"), QStringLiteral("ops"), QStringLiteral("qa") });
        record.reset();
        QVERIFY(cacheRecordFromJson(record, QString::fromUtf8(QJsonDocument(json).toJson())));
        QVERIFY(record->writeToFile(at("10001")));
        QCOMPARE(m_root.readFile(kDir + QLatin1String("10001")).toHex(), recordFile(4000000000u, "@alice", 3).toHex());
        QVERIFY(!record->fromJsonString(QStringLiteral("[1, 2]")) && !record->fromJsonString(QStringLiteral("{")));
        QCOMPARE(record->uid(), 4000000000u);
        QVERIFY(!cacheRecordFromJson(record, QStringLiteral("{\"version\": 2}")) && record.isNull());
        QCOMPARE(SyslogCapture::lines().size(), 3);
    }

    // The replies written by hand must read exactly as the document writer would write them.
    void compactJsonString_data()
    {
        QTest::addColumn<QString>("text");
        QTest::newRow("plain") << QStringLiteral("/home/@alice");
        QTest::newRow("quotes and escapes") << QStringLiteral("a\"b\\c\b\f\n\r\t\x01\x1f\x7f/");
        QTest::newRow("two to four UTF-8 bytes") << QString::fromUtf8("\xc3\xa9\xe4\xb8\xad\xf0\x9f\x98\x80");
        QTest::newRow("lone surrogates") << QString(QChar(0xd83d)) + QLatin1Char('x') + QChar(0xde00);
    }
    void compactJsonString()
    {
        QFETCH(QString, text);
        const QByteArray document = QJsonDocument(QJsonArray { text }).toJson(QJsonDocument::Compact);
        QByteArray written = "[";
        CompactJson::append(written, text);
        QCOMPARE(written + ']', document);
    }

    // What the socket does not take at once is sent as it drains, in order; the peer's leaving is seen.
    void connectionWritesWhatDoesNotFit()
    {
        int pair[2];
        QVERIFY(socketpair(AF_UNIX, SOCK_STREAM, 0, pair) == 0);
        const int small = 4096;
        setsockopt(pair[0], SOL_SOCKET, SO_SNDBUF, &small, sizeof(small));
        LocalConnection connection(pair[0]);
        QByteArray sent(128 * 1024, Qt::Uninitialized);
        for (int i = 0; i < sent.size(); ++i)
            sent[i] = char(i % 251);
        connection.write(sent);
        QByteArray received;
        char buffer[65536];
        QVERIFY(QTest::qWaitFor([&] {
            for (ssize_t got; (got = recv(pair[1], buffer, sizeof(buffer), MSG_DONTWAIT)) > 0;)
                received.append(buffer, int(got));
            return received.size() >= sent.size();
        }));
        QCOMPARE(received, sent);
        QVERIFY(!connection.peerHasLeft());
        close(pair[1]);
        QVERIFY(connection.peerHasLeft());
    }

    void readFromFile_data()
    {
        QTest::addColumn<QByteArray>("content"); // null: no file
        QTest::addColumn<QString>("result"); // what it returned, then version, uid, account, main gid
        const auto row = [](const char *name, const QByteArray &file, const char *result) {
            QTest::newRow(name) << file << QString::fromLatin1(result);
        };
        const QByteArray start = le(kCacheVersion1_0, 4) + le(0, 8) + le(10001, 4);
        // A stale encrypted zone is read and skipped in forms().
        row("missing", QByteArray(), "0 0|0||0");
        row("1.0 plus one", le(0x01000001, 4) + start.mid(4), "0 16777217|0||0");
        row("cut inside the account", recordFile().left(23), "1 16777216|10001|@al|0");
        row("account of nearly 4 GiB", start + le(0xFFFFFFF0u, 4) + "@alice", "1 16777216|10001|@alice|0");
        row("zero byte inside the account", start + str(QByteArray("@al\0ice", 7)) + le(4242, 4),
            "1 16777216|10001|@al|4242");
    }

    void readFromFile()
    {
        QFETCH(QByteArray, content);
        QVERIFY(content.isNull() || put("10001", content));
        const CacheControlPtr record = createCacheControl();
        largest = 0;
        const bool result = record->readFromFile(at("10001"));
        const long long peak = largest.exchange(-1);
        QVERIFY2(peak < 1024 * 1024, qPrintable(QString::number(peak)));
        QTEST(QString::asprintf("%d %u|%u|%s|%u", result, record->storedVersion(), record->uid(),
                  qUtf8Printable(record->account()), record->mainGid()),
            "result");
    }

    // Only regular files named by digits are records. The clean-up keeps those below 10000 and hands the others
    // to root before it deletes them; the removal of all leaves what is not a record, a link's target included.
    void store()
    {
        for (const char *name : { "999", "9999", "10000", "65534" })
            QVERIFY(put(name, recordFile(QByteArray(name).toUInt())));
        QVERIFY(put("10001", recordFile()) && put("20002", recordFile(20002, "@bob")) && put("10001.bak", "x"));
        QVERIFY(put("abc", "x") && m_root.writeFile(QStringLiteral("/linked"), recordFile(10003)));
        QVERIFY(QDir().mkpath(at("10002")) && QFile::link(m_root.filePath(QStringLiteral("/linked")), at("10003")));
        // A second name of 10000 outlives the deletion and shows that the owner was changed before it.
        const QByteArray second = QFile::encodeName(m_root.filePath(QStringLiteral("/second")));
        QVERIFY(::link(QFile::encodeName(at("10000")).constData(), second.constData()) == 0
            && ::chown(second.constData(), 12345, 12345) == 0);

        QCOMPARE(uids(), (QList<quint32> { 999, 9999, 10000, 10001, 20002, 65534 }));
        quint32 uid = 0;
        QVERIFY(findCacheUidByAccount(QStringLiteral("@bob"), uid) && uid == 20002);
        QVERIFY(!findCacheUidByAccount(QStringLiteral("@Alice"), uid) && uid == 0);
        // A known uid that holds another account leaves the search to the listing.
        QVERIFY(findCacheUidByAccount(QStringLiteral("@bob"), uid, 10001) && uid == 20002);

        ::cleanDomainUserCacheFiles();
        QCOMPARE(uids(), (QList<quint32> { 999, 9999 }));
        QCOMPARE(QFileInfo(QFile::decodeName(second)).ownerId() | QFileInfo(QFile::decodeName(second)).groupId(), 0u);
        SyslogCapture::clear();
        removeAllCacheFiles();
        const QDir::Filters all = QDir::AllEntries | QDir::System | QDir::NoDotAndDotDot;
        QCOMPARE(QDir(m_root.workDir()).entryList(all, QDir::Name).join(QLatin1Char(' ')),
            QStringLiteral("10001.bak 10002 10003 abc"));
        QVERIFY(QFile::exists(m_root.filePath(QStringLiteral("/linked"))) && SyslogCapture::lines().isEmpty());
    }

    // A record kept from an earlier read must give way to any later change of its file, the same size
    // included, and a link put in its place answers nothing.
    void readCacheRecordSeesChanges()
    {
        QFile file(at("10001"));
        QVERIFY(put("10001", recordFile()) && file.open(QIODevice::ReadOnly)
            && file.setFileTime(QDateTime::currentDateTime().addSecs(-60), QFileDevice::FileModificationTime));
        // Past the time within which a file's time stamps may not show a further change.
        QThread::msleep(150);
        QCOMPARE(readCacheRecord(10001)->removeStatus(), 0u);
        QCOMPARE(readCacheRecord(10001)->removeStatus(), 0u);
        QVERIFY(put("10001", recordFile(10001, "@alice", 1)));
        QCOMPARE(readCacheRecord(10001)->removeStatus(), 1u);
        QVERIFY(put("other", recordFile(10001, "@alice", 2)) && QFile::remove(at("10001"))
            && QFile::link(at("other"), at("10001")));
        QVERIFY(readCacheRecord(10001).isNull());
    }

    // Each refusal logs one warning.
    void checkOfflineLogin_data()
    {
        QTest::addColumn<int>("days"); // the validity; below 0: offline login switched off
        QTest::addColumn<quint32>("removeStatus");
        QTest::addColumn<qint64>("age"); // seconds from the last login to now; below 0: no record
        QTest::addColumn<bool>("allowed");
        const qint64 week = 7 * 86400;
        QTest::newRow("exactly seven days") << 7 << 0u << week << true;
        QTest::newRow("seven days and a second") << 7 << 0u << week + 1 << false;
        QTest::newRow("no record") << 7 << 0u << qint64(-1) << false;
        QTest::newRow("marked for deletion") << 7 << 4000000000u << qint64(0) << false;
        QTest::newRow("switched off") << -7 << 0u << qint64(0) << false;
        // 49711 days are 63104 s in 32 bits: the validity wraps.
        QTest::newRow("wrapped validity, past it") << 49711 << 0u << qint64(63105) << false;
    }

    void checkOfflineLogin()
    {
        QFETCH(int, days);
        QFETCH(quint32, removeStatus);
        QFETCH(qint64, age);
        QVERIFY(m_root.writeSettings("[offline_login]\nenable=" + QByteArray(days > 0 ? "true" : "false")
            + "\ncache_validity=" + QByteArray::number(qAbs(days)) + '\n'));
        // The decision depends on the current second: repeat when the clock moved on meanwhile.
        qint64 now = 0;
        bool allowed = false;
        for (int attempt = 0; attempt < 10 && now != QDateTime::currentSecsSinceEpoch(); ++attempt) {
            SyslogCapture::clear();
            now = QDateTime::currentSecsSinceEpoch();
            QVERIFY(age < 0 || put("10001", recordFile(10001, "@alice", removeStatus, quint64(now - age))));
            allowed = ::checkOfflineLogin(QStringLiteral("@alice"));
        }
        QTEST(allowed, "allowed");
        QCOMPARE(SyslogCapture::lines().size(), allowed ? 0 : 1);
    }

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

    // Home and shell defaults ignore the home setting; special names go to the specials file only, which is
    // readable by all and so never holds the digest.
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
        const QString line = QStringLiteral("%1:x:10005:10000::%2:/bin/bash\n").arg(name, home);
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
        QCOMPARE(
            users.addUser(user(alice, 10002, digest, { QStringLiteral("sudo") })), UserListManager::Added::Refused);
        QCOMPARE(SyslogCapture::matching("system refused login.").value(0).priority, 2); // another uid for the name
        QVERIFY(!readCacheRecord(10002) && !groups.groupsOfUser(alice).contains(QStringLiteral("sudo")));

        // A look-up's "x" keeps the digest and the last login; a new gid without a name adds the machine's group.
        users.recordLogin(alice);
        const quint64 login = readCacheRecord(10001)->lastLoginTime();
        users.addUser(user(alice, 10001, QStringLiteral("x"), {}, 100));
        QVERIFY(readCacheRecord(10001)->password() == digest && readCacheRecord(10001)->lastLoginTime() == login);
        QVERIFY(groups.groupsOfUser(alice).contains(QStringLiteral("users")));

        // Another name for a listed uid would take over that account's files: refused, nothing written.
        QCOMPARE(users.addUser(user(QStringLiteral("@dave"), 10001)), UserListManager::Added::Refused);
        QVERIFY(readCacheRecord(10001)->account() == alice && !users.hasUserName(QStringLiteral("@dave")));
    }

    // The removal mark outlives a rewrite of the record; only deleting the record clears it.
    void removalMarkSurvives()
    {
        TestRoot root;
        QVERIFY(writeRecord(10001, "@alice", 1));
        GroupListManager groups;
        UserListManager users(&groups);
        QCOMPARE(users.addUser(user(alice, 10001, digest, { QStringLiteral("lp") })), UserListManager::Added::Written);
        QCOMPARE(readCacheRecord(10001)->removeStatus(), 1u);
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

    void standardGroupsAndGids_data()
    {
        QTest::addColumn<QByteArray>("file"); // null: no groups file
        QTest::addColumn<uint>("firstFree");
        QTest::newRow("no file") << QByteArray() << 5000u;
        QTest::newRow("5000 and 7000") << QByteArray("a:x:5000:\nb:x:7000:\n") << 5001u;
        QTest::newRow("7000 before 5000") << QByteArray("b:x:7000:\na:x:5000:\n") << 5001u;
        QTest::newRow("above the range") << QByteArray("a:x:10500:\n") << 5000u;
    }

    // The machine's standard groups keep its gids and members; the others take the lowest free gids in turn.
    void standardGroupsAndGids()
    {
        QFETCH(QByteArray, file);
        QFETCH(uint, firstFree);
        TestRoot root;
        if (!file.isNull())
            QVERIFY(root.writeFile(groupsFile, file));
        GroupListManager groups;
        uint next = firstFree;
        for (const char *name : { "sudo", "lp", "lpadmin", "dialout", "scanner", "kest" }) {
            const GroupEntryPtr entry = groups.findGroup(QString::fromLatin1(name));
            QVERIFY2(entry, name);
            if (const struct group *system = getgrnam(name)) {
                QCOMPARE(entry->gid, uint(system->gr_gid));
                QCOMPARE(entry->members.size(),
                    int(std::distance(system->gr_mem, std::find(system->gr_mem, system->gr_mem + 64, nullptr))));
            } else {
                QCOMPARE(entry->gid, qstrcmp(name, "kest") == 0 ? 10000u : next++);
                QCOMPARE(entry->password, QStringLiteral("x"));
            }
        }
        QCOMPARE(groups.nextFreeGid(), next);
        groups.saveGroups();
        // A restart keeps every gid.
        const QByteArray saved = root.readFile(groupsFile);
        GroupListManager again;
        again.saveGroups();
        QCOMPARE(root.readFile(groupsFile), saved);
    }

    // Lines come back as written, member texts of up to six characters with their trailing comma, which
    // names nobody when read; the placeholder group "x" and invalid lines are dropped.
    void fileLinesAndRemovals()
    {
        TestRoot root;
        QVERIFY(root.writeFile(groupsFile,
            "team:x:6000:@alice,local,@bob\nbroken:x:42\nx:x:6001:@alice\ntwice:x:6002:bob,bob,\nsix:x:6003:abcde\n"
            "seven:x:6004:abcdef,\npair:x:6005:alice,bob,\n"));
        GroupListManager groups;
        QVERIFY(!groups.findGroup(QStringLiteral("broken")));
        groups.addUserToGroup(QStringLiteral("x"), QStringLiteral("carol"));
        groups.addUserToGroup(QStringLiteral("twice"), QStringLiteral("bob"));
        QCOMPARE(groups.groupsOfUser(QStringLiteral("@alice")), QStringList { QStringLiteral("team") });

        groups.removeUserFromGroups(QStringLiteral("@alice")); // in memory only
        QVERIFY(root.readFile(groupsFile).contains("@alice"));
        groups.removeGroupMember(QStringLiteral("team"), QStringLiteral("local"));
        QByteArrayList lines;
        for (const char *name : { "team", "x", "twice", "six", "seven", "pair" })
            lines << lineOf(root, name);
        QCOMPARE(lines.join('\n'),
            "team:x:6000:@bob,\n\ntwice:x:6002:bob,\nsix:x:6003:abcde,\nseven:x:6004:abcdef\npair:x:6005:alice,bob");
        groups.removeDomainMembers();
        QCOMPARE(lineOf(root, "team"), QByteArray("team:x:6000:"));

        QVERIFY(QFile::remove(root.filePath(groupsFile)) && QDir().mkpath(root.filePath(groupsFile)));
        groups.saveGroups();
        QCOMPARE(SyslogCapture::count("cannot write groups file. "), 1);
    }

    void repair_data()
    {
        QTest::addColumn<QString>("user");
        // A trailing "/" makes a directory, "@" a link out of the home, "*" a file listed before the directory.
        QTest::addColumn<QStringList>("entries");
        QTest::addColumn<uint>("owner"); // the home's owner before
        QTest::addColumn<QByteArray>("logged");
        QTest::addColumn<uint>("mode"); // the home's after a change, when the order of its entries settles it
        const auto row
            = [](const char *name, const char *user, const char *entries, uint owner, const char *logged, uint mode) {
                  QTest::newRow(name) << QString::fromLatin1(user)
                                      << QString::fromLatin1(entries).split(QLatin1Char(' '), Qt::SkipEmptyParts)
                                      << owner << QByteArray(logged) << mode;
              };
        row("no home", "@alice", "", 0, "user home directory is not exists.", 0);
        row("unknown user", "@bob", "f", 0, "cannot find user id: @bob", 0);
        row("already owned", "@alice", "f", 10001, " owner @alice is already right.", 0);
        row("files, hidden ones not counted", "@alice", "a b .profile .cache/", 0,
            "changed user:  @alice  home  0  directories and  2  files", 0x640);
        row("subdirectories and links end the walk", "@alice", "a docs/ music/ out@", 0,
            "changed user:  @alice  home  3  directories and  1  files", 0);
        // Entries come in the file system's own order, not sorted: a directory listed last leaves its mode.
        row("directory listed last", "@alice", "docs/ *", 0,
            "changed user:  @alice  home  1  directories and  1  files", 0x750);
    }

    void repair()
    {
        QFETCH(QString, user);
        QFETCH(QStringList, entries);
        QFETCH(uint, owner);
        QFETCH(QByteArray, logged);
        QFETCH(uint, mode);
        TestRoot root;
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(
            QJsonObject { { QStringLiteral("name"), QStringLiteral("@alice") }, { QStringLiteral("uid"), 10001 } });
        const QString home = root.filePath(QStringLiteral("/home/") + user);
        const QString outside = root.filePath(QStringLiteral("/srv"));
        for (const QString &entry : qAsConst(entries)) {
            const QString path = home + QLatin1Char('/') + entry;
            QVERIFY(QDir().mkpath(home) && QDir().mkpath(outside));
            QVERIFY(entry.endsWith(QLatin1Char('/')) ? QDir().mkpath(path + QStringLiteral("inner"))
                    : entry.endsWith(QLatin1Char('@'))
                    ? QFile::link(outside, path)
                    : entry == QLatin1String("*") || QFile(path).open(QIODevice::WriteOnly));
        }
        // The one file "*" stands for takes names until the file system lists it before the directory.
        for (int i = 0;
             entries.contains(QStringLiteral("*")) && (i == 0 || listed(home).constLast() != QLatin1String("docs"));
             ++i) {
            QVERIFY2(i < 50, "no file name the file system lists first");
            QFile::remove(home + QStringLiteral("/z%1.txt").arg(i - 1));
            QVERIFY(QFile(home + QStringLiteral("/z%1.txt").arg(i)).open(QIODevice::WriteOnly));
        }
        QVERIFY(entries.isEmpty() || chown(QFile::encodeName(home).constData(), owner, 0) == 0);
        const mode_t before = statOf(home).st_mode;
        SyslogCapture::clear();

        HomeDirectoryRepair::repair(user, users);
        QCOMPARE(SyslogCapture::lines().size(), 1);
        QVERIFY2(SyslogCapture::lines().first().text.endsWith(logged), SyslogCapture::lines().first().text);
        const bool changed = logged.startsWith("changed");
        QCOMPARE(statOf(home).st_uid, changed ? uid_t(10001) : uid_t(owner));
        QCOMPARE(statOf(home).st_gid, changed ? gid_t(10000) : gid_t(0));
        if (!changed || mode)
            QCOMPARE(statOf(home).st_mode & (mode ? 07777 : ~0u), mode ? mode : before);
        // The walk changes the directories that hold entries, never the entries themselves nor what links point to.
        for (const QString &name : listed(home))
            QCOMPARE(statOf(home + QLatin1Char('/') + name).st_uid, uid_t(0));
    }

private:
    // Record files are built here byte by byte, without the code under test.
    static QByteArray le(quint64 value, int size)
    {
        return size ? char(value) + le(value >> 8, size - 1) : QByteArray();
    }
    static QByteArray str(const QByteArray &utf8) { return le(quint64(utf8.size()), 4) + utf8; }
    static QByteArray recordFile(quint32 uid = 10001, const QByteArray &account = "@alice", quint32 removeStatus = 0,
        quint64 lastLogin = 1700000000, const QByteArray &zone = QByteArray())
    {
        return le(kCacheVersion1_0, 4) + le(0, 8) + le(uid, 4) + str(account) + le(20001, 4) + str("alice") + le(2, 4)
            + str("dev") + str("ops") + le(1, 4) + str("wheel") + str("Alice \xc3\x84. Example")
            + str("/home/remote/alice") + str("/bin/bash") + le(604800, 8) + le(lastLogin, 8) + str(zone)
            + str("5e884898da28047151d0e56f8dc6292773603d0d6aabbdd62a11ef721d1542d8") + le(removeStatus, 4);
    }
    QString at(const char *name) const { return m_root.workDir() + QLatin1Char('/') + QLatin1String(name); }
    bool put(const char *name, const QByteArray &data) { return m_root.writeFile(kDir + QLatin1String(name), data); }
    static QList<quint32> uids()
    {
        auto all = listCacheUids();
        std::sort(all.begin(), all.end());
        return all;
    }

    const QString kDir = QStringLiteral("/var/lib/libkest-iam/");
    TestRoot m_root;
};

QTEST_GUILESS_MAIN(AccountCacheTest)
#include "test_accountcache.moc"
