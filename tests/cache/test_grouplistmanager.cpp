#include "grouplistmanager.h"
#include "messagehandler.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QDir>
#include <QTest>

#include <grp.h>

namespace
{
const QString groupsFile = QStringLiteral("/var/lib/libkest-iam/groups.txt");

// The group's line in the groups file; empty when there is none.
QByteArray lineOf(const TestRoot &root, const QByteArray &group)
{
    const QByteArray file = root.readFile(groupsFile);
    const int at = ('\n' + file).indexOf('\n' + group + ':');
    return at < 0 ? QByteArray() : file.mid(at, file.indexOf('\n', at) - at);
}
} // namespace

class GroupListManagerTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase() { qInstallMessageHandler(messageHandler); }
    void init() { SyslogCapture::clear(); }

    void standardGroupsAndGids_data()
    {
        QTest::addColumn<QByteArray>("file"); // null: no groups file
        QTest::addColumn<uint>("firstFree");
        QTest::newRow("no file") << QByteArray() << 5000u;
        QTest::newRow("5000 and 7000") << QByteArray("a:x:5000:\nb:x:7000:\n") << 7001u;
        QTest::newRow("7000 before 5000") << QByteArray("b:x:7000:\na:x:5000:\n") << 7001u;
        QTest::newRow("above the range") << QByteArray("a:x:10500:\n") << 5000u;
    }

    // The machine's standard groups keep its gids and members; the others take free gids in turn.
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
};

QTEST_GUILESS_MAIN(GroupListManagerTest)
#include "test_grouplistmanager.moc"
