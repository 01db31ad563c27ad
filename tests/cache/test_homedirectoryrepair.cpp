#include "grouplistmanager.h"
#include "homedirectoryrepair.h"
#include "messagehandler.h"
#include "syslogcapture.h"
#include "testroot.h"
#include "userlistmanager.h"

#include <QDir>
#include <QJsonObject>
#include <QTest>

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

namespace
{
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

class HomeDirectoryRepairTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase() { qInstallMessageHandler(messageHandler); }

    void repair_data()
    {
        QTest::addColumn<QString>("user");
        QTest::addColumn<QStringList>("entries"); // a trailing "/" makes a directory
        QTest::addColumn<uint>("owner"); // the home's owner before
        QTest::addColumn<QByteArray>("logged");
        QTest::newRow("no home") << QStringLiteral("@alice") << QStringList() << 0u
                                 << QByteArray("user home directory is not exists.");
        QTest::newRow("unknown user") << QStringLiteral("@bob") << QStringList { QStringLiteral("f") } << 0u
                                      << QByteArray("cannot find user id: @bob");
        QTest::newRow("already owned") << QStringLiteral("@alice") << QStringList { QStringLiteral("f") } << 10001u
                                       << QByteArray(" owner @alice is already right.");
        QTest::newRow("files, hidden ones not counted")
            << QStringLiteral("@alice")
            << QStringList { QStringLiteral("a"), QStringLiteral("b"), QStringLiteral(".profile"),
                   QStringLiteral(".cache/") }
            << 0u << QByteArray("changed user:  @alice  home  0  directories and  2  files");
        QTest::newRow("subdirectories end the walk")
            << QStringLiteral("@alice")
            << QStringList { QStringLiteral("a"), QStringLiteral("docs/"), QStringLiteral("music/") } << 0u
            << QByteArray("changed user:  @alice  home  2  directories and  1  files");
    }

    void repair()
    {
        QFETCH(QString, user);
        QFETCH(QStringList, entries);
        QFETCH(uint, owner);
        QFETCH(QByteArray, logged);
        TestRoot root;
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(
            QJsonObject { { QStringLiteral("name"), QStringLiteral("@alice") }, { QStringLiteral("uid"), 10001 } });
        const QString home = root.filePath(QStringLiteral("/home/") + user);
        for (const QString &entry : qAsConst(entries))
            QVERIFY(entry.endsWith(QLatin1Char('/'))
                    ? QDir().mkpath(home + QLatin1Char('/') + entry + QStringLiteral("inner"))
                    : root.writeFile(QStringLiteral("/home/") + user + QLatin1Char('/') + entry, "x"));
        QVERIFY(entries.isEmpty() || chown(QFile::encodeName(home).constData(), owner, 0) == 0);
        const mode_t before = statOf(home).st_mode;
        SyslogCapture::clear();

        HomeDirectoryRepair::repair(user, users);
        QCOMPARE(SyslogCapture::lines().size(), 1);
        QVERIFY2(SyslogCapture::lines().first().text.endsWith(logged), SyslogCapture::lines().first().text);
        const bool changed = logged.startsWith("changed");
        QCOMPARE(statOf(home).st_uid, changed ? uid_t(10001) : uid_t(owner));
        QCOMPARE(statOf(home).st_gid, changed ? gid_t(10000) : gid_t(0));
        if (!changed)
            QCOMPARE(statOf(home).st_mode, before);
        else if (logged.contains("  0  directories"))
            QCOMPARE(statOf(home).st_mode & 07777, mode_t(0x640));
        // The walk changes the directories that hold entries, never the entries themselves.
        for (const QString &entry : qAsConst(entries))
            QCOMPARE(statOf(home + QLatin1Char('/') + entry).st_uid, uid_t(0));
    }

    // Entries come in the file system's own order, not sorted: a directory listed last leaves its mode.
    void walkKeepsTheListingOrder()
    {
        TestRoot root;
        GroupListManager groups;
        UserListManager users(&groups);
        users.addUser(
            QJsonObject { { QStringLiteral("name"), QStringLiteral("@alice") }, { QStringLiteral("uid"), 10001 } });
        const QString home = root.filePath(QStringLiteral("/home/@alice"));
        QVERIFY(QDir().mkpath(home + QStringLiteral("/docs")));
        for (int i = 0; listed(home).size() < 2 || listed(home).constLast() != QLatin1String("docs"); ++i) {
            QVERIFY2(i < 50, "no file name the file system lists before docs");
            QFile::remove(home + QStringLiteral("/z%1.txt").arg(i - 1));
            QVERIFY(root.writeFile(QStringLiteral("/home/@alice/z%1.txt").arg(i), "x"));
        }
        HomeDirectoryRepair::repair(QStringLiteral("@alice"), users);
        QCOMPARE(statOf(home).st_mode & 07777, mode_t(0x750));
    }
};

QTEST_GUILESS_MAIN(HomeDirectoryRepairTest)
#include "test_homedirectoryrepair.moc"
