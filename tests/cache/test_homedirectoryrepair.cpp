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
};

QTEST_GUILESS_MAIN(HomeDirectoryRepairTest)
#include "test_homedirectoryrepair.moc"
