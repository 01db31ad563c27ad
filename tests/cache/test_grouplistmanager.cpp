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
const char *const standardGroups[] = { "sudo", "lp", "lpadmin", "dialout", "scanner", "kest" };

bool machineHasGroup(const QString &name)
{
    return getgrnam(name.toUtf8().constData()) != nullptr;
}

// Standard groups (besides "kest") that the machine lacks: each takes the next free gid at start.
uint missingStandardGroups()
{
    uint count = 0;
    for (const char *name : standardGroups) {
        if (qstrcmp(name, "kest") != 0 && !machineHasGroup(QString::fromLatin1(name)))
            ++count;
    }
    return count;
}

QByteArray lineOf(const QByteArray &file, const QByteArray &group)
{
    const QList<QByteArray> lines = file.split('\n');
    for (const QByteArray &line : lines) {
        if (line.startsWith(group + ':'))
            return line;
    }
    return QByteArray();
}
} // namespace

class GroupListManagerTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase() { qInstallMessageHandler(messageHandler); }
    void init() { SyslogCapture::clear(); }

    void standardGroupsWithoutFile()
    {
        TestRoot root;
        GroupListManager groups;
        QCOMPARE(SyslogCapture::count("cannot read groups file. "), 1);
        QCOMPARE(groups.groups().size(), 6);

        uint nextGid = 5000;
        for (const char *name : standardGroups) {
            const QString group = QString::fromLatin1(name);
            const GroupEntryPtr entry = groups.findGroup(group);
            QVERIFY2(entry, name);
            const struct group *system = getgrnam(name);
            if (system) {
                QCOMPARE(entry->gid, uint(system->gr_gid));
                QStringList members;
                for (char **member = system->gr_mem; *member; ++member)
                    members.append(QString::fromUtf8(*member));
                QCOMPARE(entry->members, members);
            } else if (group == QLatin1String("kest")) {
                QCOMPARE(entry->gid, 10000u);
                QCOMPARE(entry->password, QStringLiteral("x"));
            } else {
                QCOMPARE(entry->gid, nextGid++);
                QCOMPARE(entry->password, QStringLiteral("x"));
            }
        }
    }

    void gidAllocation_data()
    {
        QTest::addColumn<QByteArray>("file");
        QTest::addColumn<uint>("firstFree"); // before the standard groups the machine lacks took theirs

        QTest::newRow("no gids in range") << QByteArray("low:x:100:\n") << 5000u;
        QTest::newRow("5000 and 7000") << QByteArray("a:x:5000:\nb:x:7000:\n") << 7001u;
        QTest::newRow("7000 listed before 5000") << QByteArray("b:x:7000:\na:x:5000:\n") << 7001u;
        QTest::newRow("above the range is ignored") << QByteArray("a:x:10500:\n") << 5000u;
        QTest::newRow("range full") << QByteArray("a:x:9999:\n") << 10000u;
    }

    void gidAllocation()
    {
        QFETCH(QByteArray, file);
        QFETCH(uint, firstFree);
        TestRoot root;
        QVERIFY(root.writeFile(groupsFile, file));
        GroupListManager groups;
        const uint expected = firstFree == 10000u ? 10000u : firstFree + missingStandardGroups();
        QCOMPARE(groups.nextFreeGid(), expected);
        groups.addGroupMember(QStringLiteral("kest-new-group"), QString());
        QCOMPARE(groups.findGroup(QStringLiteral("kest-new-group"))->gid, expected);
    }

    void gidsSurviveARestart()
    {
        TestRoot root;
        {
            GroupListManager groups;
            groups.addGroupMember(QStringLiteral("kest-extra"), QStringLiteral("@alice"));
            groups.saveGroups();
        }
        const QByteArray first = root.readFile(groupsFile);
        {
            GroupListManager groups;
            groups.saveGroups();
        }
        QCOMPARE(root.readFile(groupsFile), first);
    }

    void readsAndReportsLines()
    {
        TestRoot root;
        QVERIFY(root.writeFile(groupsFile, "team:x:6000:@alice,@bob\nbroken:x:42\nextra:x:6001:@carol:ignored\n"));
        GroupListManager groups;
        QCOMPARE(SyslogCapture::count("invalid groups line: broken:x:42"), 1);
        QCOMPARE(SyslogCapture::matching("invalid groups line: ").first().priority, 4);
        QVERIFY(!groups.findGroup(QStringLiteral("broken")));
        QCOMPARE(groups.findGroup(QStringLiteral("team"))->members,
            QStringList({ QStringLiteral("@alice"), QStringLiteral("@bob") }));
        QCOMPARE(groups.findGroup(QStringLiteral("extra"))->gid, 6001u);
        QCOMPARE(groups.groupsOfUser(QStringLiteral("@alice")), QStringList { QStringLiteral("team") });
        QCOMPARE(groups.groupsOfUser(QStringLiteral("@Alice")), QStringList());
    }

    void memberText_data()
    {
        QTest::addColumn<QStringList>("members");
        QTest::addColumn<QByteArray>("written");
        QTest::newRow("none") << QStringList() << QByteArray("");
        QTest::newRow("bob keeps comma") << QStringList { QStringLiteral("bob") } << QByteArray("bob,");
        QTest::newRow("six characters") << QStringList { QStringLiteral("abcde") } << QByteArray("abcde,");
        QTest::newRow("seven characters") << QStringList { QStringLiteral("abcdef") } << QByteArray("abcdef");
        QTest::newRow("alice,bob") << QStringList { QStringLiteral("alice"), QStringLiteral("bob") }
                                   << QByteArray("alice,bob");
        QTest::newRow("twice the same") << QStringList { QStringLiteral("bob"), QStringLiteral("bob") }
                                        << QByteArray("bob,");
    }

    void memberText()
    {
        QFETCH(QStringList, members);
        QFETCH(QByteArray, written);
        TestRoot root;
        for (int round = 0; round < 3; ++round) {
            // Reading back what was written must not grow the member list.
            GroupListManager groups;
            groups.addGroupMember(QStringLiteral("kest-team"), QString());
            for (const QString &member : qAsConst(members))
                groups.addUserToGroup(QStringLiteral("kest-team"), member);
            groups.saveGroups();
            const QByteArray line = lineOf(root.readFile(groupsFile), "kest-team");
            QCOMPARE(line.mid(line.lastIndexOf(':') + 1), written);
        }
    }

    void placeholderGroupX()
    {
        TestRoot root;
        QVERIFY(root.writeFile(groupsFile, "x:x:6000:bob\nreal:x:6001:bob\n"));
        GroupListManager groups;
        groups.addUserToGroup(QStringLiteral("x"), QStringLiteral("carol"));
        QVERIFY(!groups.findGroup(QStringLiteral("x"))->members.contains(QStringLiteral("carol")));
        QCOMPARE(groups.groupsOfUser(QStringLiteral("bob")), QStringList { QStringLiteral("real") });
        groups.saveGroups();
        const QByteArray file = root.readFile(groupsFile);
        QVERIFY(lineOf(file, "x").isEmpty());
        QVERIFY(!lineOf(file, "real").isEmpty());
    }

    void removals()
    {
        TestRoot root;
        QVERIFY(root.writeFile(groupsFile, "team:x:6000:@alice,local,@bob\nother:x:6001:@alice\n"));
        GroupListManager groups;

        groups.removeUserFromGroups(QStringLiteral("@alice"));
        QCOMPARE(groups.groupsOfUser(QStringLiteral("@alice")), QStringList());
        QVERIFY(root.readFile(groupsFile).contains("@alice")); // not saved by this one

        groups.removeGroupMember(QStringLiteral("team"), QStringLiteral("nobody"));
        QVERIFY(root.readFile(groupsFile).contains("@alice"));
        groups.removeGroupMember(QStringLiteral("team"), QStringLiteral("local"));
        QCOMPARE(lineOf(root.readFile(groupsFile), "team"), QByteArray("team:x:6000:@bob,"));

        groups.removeDomainMembers();
        const QByteArray file = root.readFile(groupsFile);
        QCOMPARE(lineOf(file, "team"), QByteArray("team:x:6000:"));
        QVERIFY(!file.contains('@'));
    }

    void unwritableFile()
    {
        TestRoot root;
        QVERIFY(QDir().mkpath(root.filePath(groupsFile)));
        GroupListManager groups;
        groups.saveGroups();
        QCOMPARE(SyslogCapture::count("cannot write groups file. "), 1);
    }

    void systemGroupNameByGid()
    {
        TestRoot root;
        GroupListManager groups;
        QCOMPARE(groups.systemGroupName(0), QStringLiteral("root"));
        QCOMPARE(groups.systemGroupName(4000000000u), QString());
    }
};

QTEST_GUILESS_MAIN(GroupListManagerTest)
#include "test_grouplistmanager.moc"
