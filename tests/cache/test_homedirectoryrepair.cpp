#include "grouplistmanager.h"
#include "homedirectoryrepair.h"
#include "messagehandler.h"
#include "syslogcapture.h"
#include "testroot.h"
#include "userlistmanager.h"

#include <QDir>
#include <QJsonObject>
#include <QTest>

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
} // namespace

class HomeDirectoryRepairTest : public QObject
{
    Q_OBJECT

private:
    TestRoot *m_root = nullptr;
    GroupListManager *m_groups = nullptr;
    UserListManager *m_users = nullptr;

    QString home() const { return m_root->filePath(QStringLiteral("/home/@alice")); }

private Q_SLOTS:
    void initTestCase() { qInstallMessageHandler(messageHandler); }

    void init()
    {
        SyslogCapture::clear();
        m_root = new TestRoot;
        m_groups = new GroupListManager;
        m_users = new UserListManager(m_groups);
        m_users->addUser(QJsonObject { { QStringLiteral("name"), QStringLiteral("@alice") },
            { QStringLiteral("uid"), 10001 }, { QStringLiteral("password"), QStringLiteral("x") } });
        SyslogCapture::clear();
    }

    void cleanup()
    {
        delete m_users;
        delete m_groups;
        delete m_root;
    }

    void missingHome()
    {
        HomeDirectoryRepair::repair(QStringLiteral("@alice"), *m_users);
        QCOMPARE(SyslogCapture::count("user home directory is not exists."), 1);
        QCOMPARE(SyslogCapture::lines().size(), 1);
    }

    void unknownUser()
    {
        QVERIFY(QDir().mkpath(m_root->filePath(QStringLiteral("/home/@bob"))));
        HomeDirectoryRepair::repair(QStringLiteral("@bob"), *m_users);
        QCOMPARE(SyslogCapture::count("cannot find user id: @bob"), 1);
        QCOMPARE(statOf(m_root->filePath(QStringLiteral("/home/@bob"))).st_uid, uid_t(0));
    }

    void alreadyOwnedIsLeftAlone()
    {
        QVERIFY(QDir().mkpath(home()));
        QVERIFY(m_root->writeFile(QStringLiteral("/home/@alice/file"), "data"));
        QCOMPARE(chown(QFile::encodeName(home()).constData(), 10001, 0), 0);
        const mode_t modeBefore = statOf(home()).st_mode;
        HomeDirectoryRepair::repair(QStringLiteral("@alice"), *m_users);
        QCOMPARE(SyslogCapture::count("directory " + QFile::encodeName(home()) + " owner @alice is already right."), 1);
        QCOMPARE(statOf(home()).st_mode, modeBefore);
        QCOMPARE(statOf(home()).st_gid, gid_t(0));
    }

    void walk_data()
    {
        QTest::addColumn<QStringList>("files");
        QTest::addColumn<QStringList>("directories");
        QTest::addColumn<QByteArray>("summary");

        QTest::newRow("files only") << QStringList { QStringLiteral("a"), QStringLiteral("b"), QStringLiteral("c") }
                                    << QStringList() << QByteArray("0  directories and  3  files");
        QTest::newRow("hidden entries are not counted")
            << QStringList { QStringLiteral("a"), QStringLiteral(".profile") }
            << QStringList { QStringLiteral(".cache") } << QByteArray("0  directories and  1  files");
        QTest::newRow("a subdirectory ends the walk")
            << QStringList { QStringLiteral("a") } << QStringList { QStringLiteral("docs"), QStringLiteral("music") }
            << QByteArray("2  directories and  1  files");
        QTest::newRow("empty") << QStringList() << QStringList() << QByteArray("0  directories and  0  files");
    }

    void walk()
    {
        QFETCH(QStringList, files);
        QFETCH(QStringList, directories);
        QFETCH(QByteArray, summary);
        QVERIFY(QDir().mkpath(home()));
        for (const QString &directory : qAsConst(directories))
            QVERIFY(QDir(home()).mkpath(directory + QStringLiteral("/inner")));
        for (const QString &file : qAsConst(files))
            QVERIFY(m_root->writeFile(QStringLiteral("/home/@alice/") + file, "data"));

        HomeDirectoryRepair::repair(QStringLiteral("@alice"), *m_users);
        const QList<SyslogLine> done = SyslogCapture::matching("changed user: ");
        QCOMPARE(done.size(), 1);
        QVERIFY2(done.first().text.endsWith("changed user:  @alice  home  " + summary), done.first().text.constData());
        QCOMPARE(done.first().priority, 6);

        const struct stat info = statOf(home());
        QCOMPARE(info.st_uid, uid_t(10001));
        QCOMPARE(info.st_gid, gid_t(10000));
        if (directories.isEmpty() && !files.isEmpty())
            QCOMPARE(info.st_mode & 07777, mode_t(0x640));
        // The walk changes the directories that hold entries, never the entries themselves.
        for (const QString &file : qAsConst(files))
            QCOMPARE(statOf(home() + QLatin1Char('/') + file).st_uid, uid_t(0));
        for (const QString &directory : qAsConst(directories))
            QCOMPARE(statOf(home() + QLatin1Char('/') + directory).st_uid, uid_t(0));
    }
};

QTEST_GUILESS_MAIN(HomeDirectoryRepairTest)
#include "test_homedirectoryrepair.moc"
