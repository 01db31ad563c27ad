#include "cachecontrolfactory.h"
#include "cachesetup.h"
#include "grouplistmanager.h"
#include "messagehandler.h"
#include "rawconnection.h"
#include "syslogcapture.h"
#include "testroot.h"
#include "wholefile.h"

#include <QDir>
#include <QElapsedTimer>
#include <QJsonArray>
#include <QJsonDocument>
#include <QRandomGenerator>
#include <QTest>

#include <atomic>
#include <csignal>
#include <cstdio>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace
{
const QByteArray passTrue = R"({"pass":true})";
const QStringList accounts { QStringLiteral("alice"), QStringLiteral("bob"), QStringLiteral("carol"),
    QStringLiteral("dave"), QStringLiteral("erin"), QStringLiteral("frank") };

// The default users and four more; every gecos carries the tag, so that a new tag changes every file.
QJsonObject serverData(const QString &tag = QString(), const QStringList &extraGroups = {})
{
    QJsonObject data = DomainServerFixture::defaultData();
    QJsonArray users;
    for (int i = 0; i < accounts.size(); ++i) {
        const QString name = accounts.at(i);
        users.append(QJsonObject { { QStringLiteral("uid"), 10001 + i }, { QStringLiteral("name"), name },
            { QStringLiteral("password"), name + QStringLiteral("-password") },
            { QStringLiteral("permissions"),
                QJsonArray::fromStringList(QStringList { QStringLiteral("lp") } + extraGroups) },
            { QStringLiteral("primary_group"),
                QJsonObject { { QStringLiteral("id"), 10000 }, { QStringLiteral("name"), QStringLiteral("kest") } } },
            { QStringLiteral("gecos"), name + tag }, { QStringLiteral("home"), QStringLiteral("/home/") + name },
            { QStringLiteral("shell"), QStringLiteral("/bin/bash") } });
    }
    data.insert(QStringLiteral("users"), users);
    return data;
}

// Why a file of the working directory is not whole, or empty when every one is.
QString brokenFile(const QString &workDir)
{
    const QStringList names = QDir(workDir).entryList(QDir::Files);
    for (const QString &name : names) {
        const QString path = workDir + QLatin1Char('/') + name;
        QFile file(path);
        if (WholeFile::isScratchName(name) || name == QLatin1String("filler") || !file.open(QIODevice::ReadOnly))
            continue;
        const QByteArray content = file.readAll();
        bool isNumber = false;
        const uint uid = name.toUInt(&isNumber);
        const CacheControlPtr record = createCacheControl();
        if (isNumber && (!record->readFromFile(path) || record->uid() != uid || record->account().isEmpty()))
            return name + QStringLiteral(": not a record");
        const int fields = name == QLatin1String("groups.txt") ? 4 : name == QLatin1String("specials.txt") ? 7 : 0;
        if (name == QLatin1String("groups.txt") && content.isEmpty())
            return name + QStringLiteral(": empty");
        if (fields && !content.isEmpty() && !content.endsWith('\n'))
            return name + QStringLiteral(": cut");
        for (const QByteArray &line : content.split('\n')) {
            if (fields && !line.isEmpty() && line.count(':') + 1 < fields)
                return name + QStringLiteral(": cut line ") + QString::fromUtf8(line);
        }
        if (name == QLatin1String("failed-logins") && !QJsonDocument::fromJson(content).isObject())
            return name + QStringLiteral(": not JSON");
    }
    return QString();
}

QMap<QString, QByteArray> contentsOf(const QString &directory)
{
    QMap<QString, QByteArray> contents;
    for (const QString &name : QDir(directory).entryList(QDir::Files)) {
        QFile file(directory + QLatin1Char('/') + name);
        if (name != QLatin1String("filler") && file.open(QIODevice::ReadOnly))
            contents.insert(name, file.readAll());
    }
    return contents;
}

bool fill(const QString &directory)
{
    QFile filler(directory + QStringLiteral("/filler"));
    if (!filler.open(QIODevice::WriteOnly))
        return false;
    const QByteArray block(4096, 'f');
    while (filler.write(block) == block.size() && filler.flush()) { }
    return true;
}

bool mountTmpfs(const QString &path, const char *size)
{
    const QByteArray options = QByteArray("mode=0755,size=") + size;
    return QDir().mkpath(path)
        && mount("tmpfs", QFile::encodeName(path).constData(), "tmpfs", 0, options.constData()) == 0;
}

void unmount(const QString &path)
{
    umount2(QFile::encodeName(path).constData(), MNT_DETACH);
}

struct Setup : CacheSetup {
    bool start(const char *tmpfsSize = nullptr)
    {
        return (!tmpfsSize || mountTmpfs(root.workDir(), tmpfsSize)) && server.setData(serverData())
            && CacheSetup::start();
    }
    ~Setup()
    {
        daemon.stop();
        unmount(root.workDir());
    }
    QByteArray login(const QString &name) const
    {
        return CacheSetup::login(QLatin1Char('@') + name, name + QStringLiteral("-password"));
    }
};
} // namespace

// Files replaced whole whatever happens meanwhile: a full disk, a kill at any instant, a reader at any instant.
// The test runs in a mount namespace of its own, where a small tmpfs can be full and /etc/group another file.
class FileSafetyTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        qInstallMessageHandler(messageHandler);
        QVERIFY2(unshare(CLONE_NEWNS) == 0, strerror(errno));
        QVERIFY(mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0);
    }

    // A link at the name is replaced and its target left alone; a full disk leaves the old file and no new one.
    void replaceWhole_data()
    {
        QTest::addColumn<bool>("link");
        QTest::addColumn<bool>("full");
        QTest::newRow("link at the name") << true << false;
        QTest::newRow("full disk") << false << true;
    }
    void replaceWhole()
    {
        QFETCH(bool, link);
        QFETCH(bool, full);
        TestRoot root;
        const QString dir = root.workDir(), path = dir + QStringLiteral("/file");
        QVERIFY(mountTmpfs(dir, "64k"));
        QVERIFY(root.writeFile(QStringLiteral("/etc/target"), "target")
            && root.writeFile(QStringLiteral("/var/lib/libkest-iam/file"), "old"));
        if (link)
            QVERIFY(QFile::remove(path) && QFile::link(root.filePath(QStringLiteral("/etc/target")), path));
        if (full)
            QVERIFY(fill(dir));
        QString error;
        const bool written
            = WholeFile::write(path, QByteArray(8192, 'n'), QFileDevice::ReadOwner | QFileDevice::WriteOwner, error);
        struct stat info = {};
        lstat(QFile::encodeName(path).constData(), &info);
        const QByteArray now = root.readFile(QStringLiteral("/var/lib/libkest-iam/file"));
        const QStringList names = QDir(dir).entryList(QDir::Files | QDir::System);
        unmount(dir);
        QCOMPARE(written, !full);
        QCOMPARE(now, full ? QByteArray("old") : QByteArray(8192, 'n'));
        QCOMPARE(error, full ? QString::fromLocal8Bit(strerror(ENOSPC)) : QString());
        QCOMPARE(int(info.st_mode & 0777), full ? 0644 : 0600);
        QVERIFY(S_ISREG(info.st_mode));
        QCOMPARE(root.readFile(QStringLiteral("/etc/target")), QByteArray("target"));
        QCOMPARE(names.size(), full ? 2 : 1);
    }

    // On a full disk every rewrite fails and the old files stay byte for byte; the server still decides the login,
    // and after a restart the account logs in offline.
    void fullDiskKeepsTheCache()
    {
        Setup s;
        QVERIFY2(s.start("256k"), qPrintable(s.errorText()));
        QCOMPARE(s.login(QStringLiteral("alice")) + s.login(QStringLiteral("bob")), passTrue + passTrue);
        const QMap<QString, QByteArray> before = contentsOf(s.root.workDir());
        QVERIFY(before.contains(QStringLiteral("10001")) && before.contains(QStringLiteral("groups.txt")));
        QVERIFY(fill(s.root.workDir()));
        QVERIFY(s.server.setData(serverData(QStringLiteral(" changed"), { QStringLiteral("staff2") })));
        QCOMPARE(s.login(QStringLiteral("alice")) + s.login(QStringLiteral("bob")), passTrue + passTrue);
        QCOMPARE(contentsOf(s.root.workDir()), before);
        s.daemon.stop();
        s.server.stop();
        QVERIFY(s.daemon.start());
        QCOMPARE(s.login(QStringLiteral("alice")), passTrue);
    }

    // SIGKILL at random instants of a stream of online logins: after each, every file parses and every account
    // seen so far keeps its record and digest; at the end each of them logs in offline.
    void killedAnyTimeLeavesWholeFiles()
    {
        Setup s;
        QVERIFY2(s.start(), qPrintable(s.errorText()));
        const quint32 seed = QRandomGenerator::global()->generate();
        fprintf(stderr, "seed %u\n", seed);
        QRandomGenerator random(seed);
        QMap<uint, QString> seen;
        QElapsedTimer clock;
        clock.start();
        int kills = 0;
        for (; kills < 300 && clock.elapsed() < 45000; ++kills) {
            const int account = random.bounded(accounts.size());
            RawConnection connection(s.daemon.port());
            connection.send(
                CacheDaemonFixture::frame(CacheDaemonFixture::functionCall(QStringLiteral("authenticatePassword"),
                    { QLatin1Char('@') + accounts.at(account), accounts.at(account) + QStringLiteral("-password") })));
            usleep(random.bounded(30000));
            kill(pid_t(s.daemon.processId()), SIGKILL);
            s.daemon.stop();
            const QString broken = brokenFile(s.root.workDir());
            QVERIFY2(broken.isEmpty(), qPrintable(QStringLiteral("after kill %1: ").arg(kills + 1) + broken));
            for (auto known = seen.cbegin(); known != seen.cend(); ++known) {
                const CacheControlPtr record = createCacheControl();
                QVERIFY2(record->readFromFile(s.root.workDir() + QLatin1Char('/') + QString::number(known.key()))
                        && record->password() == known.value(),
                    qPrintable(QStringLiteral("record %1 lost after kill %2").arg(known.key()).arg(kills + 1)));
            }
            for (int i = 0; i < accounts.size(); ++i) {
                const CacheControlPtr record = createCacheControl();
                if (record->readFromFile(s.root.workDir() + QLatin1Char('/') + QString::number(10001 + i))
                    && record->password().size() == 64)
                    seen.insert(10001 + i, record->password());
            }
            QVERIFY2(s.daemon.start(), qPrintable(s.daemon.errorText()));
        }
        fprintf(stderr, "%d kills survived, %d accounts seen\n", kills, int(seen.size()));
        QVERIFY(seen.size() >= 2);
        s.daemon.stop();
        s.server.stop();
        QVERIFY(s.daemon.start());
        for (auto known = seen.cbegin(); known != seen.cend(); ++known)
            QCOMPARE(s.login(accounts.at(int(known.key() - 10001))), passTrue);
        QCOMPARE(QDir(s.root.workDir()).entryList({ QStringLiteral("*.kest-new-*") }), QStringList());
    }

    // A reader looping over the files while logins rewrite them sees old or new files, never a part.
    void readerSeesWholeFiles()
    {
        Setup s;
        QVERIFY2(s.start(), qPrintable(s.errorText()));
        QCOMPARE(s.login(QStringLiteral("alice")), passTrue);
        std::atomic<bool> stop { false };
        std::atomic<int> reads { 0 };
        QString broken;
        std::thread reader([&] {
            while (!stop && broken.isEmpty()) {
                broken = brokenFile(s.root.workDir());
                ++reads;
            }
        });
        QElapsedTimer clock;
        clock.start();
        int logins = 0;
        for (; clock.elapsed() < 3000; ++logins) {
            s.server.setData(serverData(QString::number(logins), { QStringLiteral("g%1").arg(logins) }));
            s.login(QStringLiteral("alice"));
        }
        stop = true;
        reader.join();
        fprintf(stderr, "%d logins, %d whole reads\n", logins, int(reads));
        QVERIFY2(broken.isEmpty(), qPrintable(broken));
        QVERIFY(logins > 10 && reads > 10);
    }

    // A group created here takes the lowest gid of 5000-9999 that neither the list nor the machine's own groups
    // use; with none left it is not created, and the user still joins the others.
    void groupIdsNeverCollide()
    {
        TestRoot root;
        QVERIFY(root.writeFile(QStringLiteral("/etc/group-machine"),
            "root:x:0:\nsudo:x:27:\nlp:x:7:\ndialout:x:20:\nlpadmin:x:110:\nscanner:x:111:\nbusy:x:5000:\n"));
        QVERIFY(mount(QFile::encodeName(root.filePath(QStringLiteral("/etc/group-machine"))).constData(), "/etc/group",
                    nullptr, MS_BIND, nullptr)
            == 0);
        QByteArray list = "listed:x:5001:\n";
        QVERIFY(root.writeFile(QStringLiteral("/var/lib/libkest-iam/groups.txt"), list));
        uint firstFree = 0;
        {
            GroupListManager groups;
            groups.addUserToGroup(QStringLiteral("fresh"), QStringLiteral("@alice"));
            firstFree = groups.findGroup(QStringLiteral("fresh"))->gid;
        }
        for (uint gid = 5002; gid <= 9999; ++gid)
            list += "g" + QByteArray::number(gid) + ":x:" + QByteArray::number(gid) + ":\n";
        QVERIFY(root.writeFile(QStringLiteral("/var/lib/libkest-iam/groups.txt"), list));
        SyslogCapture::clear();
        GroupListManager groups;
        groups.addUserToGroup(QStringLiteral("late"), QStringLiteral("@alice"));
        groups.addUserToGroup(QStringLiteral("lp"), QStringLiteral("@alice"));
        umount2("/etc/group", MNT_DETACH);
        QCOMPARE(firstFree, 5002u);
        QVERIFY(!groups.findGroup(QStringLiteral("late")));
        QCOMPARE(SyslogCapture::count("no free group id for group: late"), 1);
        QCOMPARE(groups.groupsOfUser(QStringLiteral("@alice")), QStringList { QStringLiteral("lp") });
    }
};

QTEST_GUILESS_MAIN(FileSafetyTest)
#include "test_filesafety.moc"
