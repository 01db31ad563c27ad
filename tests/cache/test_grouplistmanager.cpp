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
        QCOMPARE(SyslogCapture::count("cannot read groups file. "), file.isNull() ? 1 : 0);
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

    void memberText_data()
    {
        QTest::addColumn<QStringList>("members");
        QTest::addColumn<QByteArray>("written");
        QTest::newRow("bob keeps the comma")
            << QStringList { QStringLiteral("bob"), QStringLiteral("bob") } << QByteArray("bob,");
        QTest::newRow("six characters") << QStringList { QStringLiteral("abcde") } << QByteArray("abcde,");
        QTest::newRow("seven characters") << QStringList { QStringLiteral("abcdef") } << QByteArray("abcdef");
        QTest::newRow("alice,bob") << QStringList { QStringLiteral("alice"), QStringLiteral("bob") }
                                   << QByteArray("alice,bob");
    }

    void memberText()
    {
        QFETCH(QStringList, members);
        QFETCH(QByteArray, written);
        TestRoot root;
        for (int round = 0; round < 3; ++round) { // reading back what was written must not grow the list
            GroupListManager groups;
            groups.addGroupMember(QStringLiteral("team"), QString());
            for (const QString &member : qAsConst(members))
                groups.addUserToGroup(QStringLiteral("team"), member);
            groups.saveGroups();
            QCOMPARE(lineOf(root, "team").split(':').value(3), written);
        }
    }

    void fileLinesAndRemovals()
    {
        TestRoot root;
        QVERIFY(root.writeFile(groupsFile, "team:x:6000:@alice,local,@bob\nbroken:x:42\nx:x:6001:@alice\n"));
        GroupListManager groups;
        QCOMPARE(SyslogCapture::count("invalid groups line: broken:x:42"), 1);
        QVERIFY(!groups.findGroup(QStringLiteral("broken")));
        groups.addUserToGroup(QStringLiteral("x"), QStringLiteral("carol"));
        QCOMPARE(groups.groupsOfUser(QStringLiteral("@alice")), QStringList { QStringLiteral("team") });
        QCOMPARE(groups.groupsOfUser(QStringLiteral("@Alice")), QStringList());

        groups.removeUserFromGroups(QStringLiteral("@alice")); // in memory only
        QVERIFY(root.readFile(groupsFile).contains("@alice"));
        groups.removeGroupMember(QStringLiteral("team"), QStringLiteral("local"));
        QCOMPARE(lineOf(root, "team"), QByteArray("team:x:6000:@bob,"));
        QVERIFY(lineOf(root, "x").isEmpty());
        groups.removeDomainMembers();
        QCOMPARE(lineOf(root, "team"), QByteArray("team:x:6000:"));

        QVERIFY(QFile::remove(root.filePath(groupsFile)) && QDir().mkpath(root.filePath(groupsFile)));
        groups.saveGroups();
        QCOMPARE(SyslogCapture::count("cannot write groups file. "), 1);
        QCOMPARE(groups.systemGroupName(0), QStringLiteral("root"));
    }
};

QTEST_GUILESS_MAIN(GroupListManagerTest)
#include "test_grouplistmanager.moc"
