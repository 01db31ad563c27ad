#include "accountmap.h"
#include "cachesetup.h"
#include "domainserverfixture.h"
#include "nssmodule.h"
#include "wrappedcommand.h"

extern "C" {
#include "account-map.h"
}

#include <QDateTime>
#include <QElapsedTimer>
#include <QFileInfo>
#include <QJsonArray>
#include <QTest>

#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

// The account map: its layout as the module reads it, then the module under glibc against the real
// cache-kest and the test domain server, with the daemon running and stopped.
class AccountMapTest : public QObject
{
    Q_OBJECT
    NssModule m_nss;
    CacheSetup m_s;

    QString mapPath() const { return m_s.root.filePath(QStringLiteral("/run/cache-kest.map")); }
    bool writeSettings(bool enabled = true) const
    {
        return m_s.writeSettings(
            { { QStringLiteral("main/enable"), enabled }, { QStringLiteral("main/negative-cache-timeout"), 2 } });
    }

    // "status entry" of one call of the loaded module (see NssModule::call).
    QByteArray call(const QByteArray &function, const QByteArray &key) const
    {
        QByteArrayList parts = m_nss.call(function, key).split(' ');
        parts.removeAt(1);
        return parts.join(' ');
    }
    // Whether the published map answers key (a name or a uid) "no such account" now.
    bool mapSaysNo(const QByteArray &key) const
    {
        const QByteArray bytes = m_s.root.readFile(QStringLiteral("/run/cache-kest.map"));
        const qint64 now = QDateTime::currentSecsSinceEpoch();
        kest_map_view view;
        return kest_map_view_init(&view, bytes.constData(), size_t(bytes.size()))
            && (key.startsWith('@') ? kest_map_negative_name(&view, key.constData(), now)
                                    : kest_map_negative_uid(&view, key.toUInt(), now))
            == KEST_MAP_FOUND;
    }
    int serverRequests() const { return m_s.server.requests().size(); }
    const QByteArray alice = "1 @alice:x:10001:10000:Alice:/home/alice:/bin/bash";

private Q_SLOTS:
    void initTestCase()
    {
        QVERIFY2(m_nss.isLoaded(), m_nss.errorText().constData());
        QVERIFY(m_s.root.writeFile(QStringLiteral("/wrapped/passwd"), "root:x:0:0:root:/root:/bin/bash\n"));
        QVERIFY(m_s.root.writeFile(QStringLiteral("/wrapped/group"), "root:x:0:\nsudo:x:27:\nlp:x:7:\n"));
        QVERIFY2(m_s.start({ { QStringLiteral("main/negative-cache-timeout"), 2 } }), qPrintable(m_s.errorText()));
        // The start-up refresh asks the server for every known account: done before any is counted.
        QTRY_VERIFY_WITH_TIMEOUT(QFileInfo::exists(m_s.root.workDir() + QStringLiteral("/groups.txt")), 5000);
    }

    void layout_data()
    {
        QTest::addColumn<QByteArray>("lookUp"); // kind and key
        QTest::addColumn<QByteArray>("result"); // what was found, or "missing"
        QTest::newRow("by name") << QByteArray("name @alice") << QByteArray("10001 10000 Alice /home/alice /bin/bash");
        QTest::newRow("by uid") << QByteArray("uid 10002") << QByteArray("10002 10000 Bob /home/bob /bin/sh");
        QTest::newRow("the first of a name")
            << QByteArray("name @bob") << QByteArray("10002 10000 Bob /home/bob /bin/sh");
        QTest::newRow("by uid only") << QByteArray("uid 10003") << QByteArray("10003 10000 Bob /b /bin/sh");
        QTest::newRow("unknown name") << QByteArray("name @carol") << QByteArray("missing");
        QTest::newRow("unknown uid") << QByteArray("uid 10004") << QByteArray("missing");
        QTest::newRow("member's groups") << QByteArray("member @alice") << QByteArray("27 10000 5001");
        QTest::newRow("group by name") << QByteArray("group kest") << QByteArray("10000 x @alice,@bob");
        QTest::newRow("group by gid") << QByteArray("gid 27") << QByteArray("27 x admin,@alice,@alice");
        QTest::newRow("line without a valid gid") << QByteArray("group broken") << QByteArray("missing");
        QTest::newRow("negative name") << QByteArray("no @carol") << QByteArray("standing");
        QTest::newRow("negative uid") << QByteArray("no 10009") << QByteArray("standing");
        QTest::newRow("negative answer ended") << QByteArray("no @dave") << QByteArray("missing");
        QTest::newRow("replaced answer") << QByteArray("no @frank") << QByteArray("missing");
    }

    void layout()
    {
        QFETCH(QByteArray, lookUp);
        AccountMap map;
        map.addAccount({ 10001, 10000, "@alice", "Alice", "/home/alice", "/bin/bash" }, true);
        map.addAccount({ 10002, 10000, "@bob", "Bob", "/home/bob", "/bin/sh" }, true);
        // A second record of the same name, which the user list gives to the first one.
        map.addAccount({ 10003, 10000, "@bob", "Bob", "/b", "/bin/sh" }, false);
        map.setGroupList("sudo:x:27:admin,@alice,@alice\nkest:x:10000:@alice,@bob\nbroken:x:0:@alice\n"
                         "lpadmin:x:5001:@alice,\nsudo:x:28:@bob");
        const qint64 now = QDateTime::currentSecsSinceEpoch();
        const QByteArray replaced = AccountMap::withNegativeAnswers(map.toBytes(), { { "@frank", 0, now + 60 } }, 1);
        const QByteArray bytes = AccountMap::withNegativeAnswers(replaced,
            { { "@carol", 0, now + 60 }, { "", 10009, now + 60 }, { "@dave", 0, now }, { "", 10010, now + 60 } }, 1);
        kest_map_view view;
        QVERIFY(kest_map_view_init(&view, bytes.constData(), size_t(bytes.size())));
        // Cut anywhere, the header no longer matches the size.
        QVERIFY(!kest_map_view_init(&view, bytes.constData(), size_t(bytes.size() - 4)));
        QVERIFY(kest_map_view_init(&view, bytes.constData(), size_t(bytes.size())));
        const auto text = [&view](struct kest_map_text text) {
            const char *bytes = kest_map_text(&view, text);
            return bytes ? QByteArray(bytes, int(text.length)) : QByteArray("?");
        };
        const QByteArray kind = lookUp.split(' ').at(0), key = lookUp.split(' ').at(1);
        QByteArrayList found;
        kest_map_result result;
        if (kind == "no") {
            result = key.startsWith('@') ? kest_map_negative_name(&view, key.constData(), now)
                                         : kest_map_negative_uid(&view, key.toUInt(), now);
            found = { "standing" };
        } else if (kind == "name" || kind == "uid") {
            kest_map_account account {};
            result = kind == "name" ? kest_map_account_by_name(&view, key.constData(), &account)
                                    : kest_map_account_by_uid(&view, key.toUInt(), &account);
            found = { QByteArray::number(account.uid), QByteArray::number(account.gid), text(account.gecos),
                text(account.home), text(account.shell) };
        } else if (kind == "member") {
            kest_map_member member {};
            result = kest_map_member_by_name(&view, key.constData(), &member);
            for (uint32_t i = 0, gid = 0; i < member.id_count && kest_map_id(&view, member.first_id, i, &gid); ++i)
                found << QByteArray::number(gid);
        } else {
            kest_map_group group {};
            result = kind == "group" ? kest_map_group_by_name(&view, key.constData(), &group)
                                     : kest_map_group_by_gid(&view, key.toUInt(), &group);
            QByteArrayList members;
            for (uint32_t i = 0, index = 0; i < group.id_count && kest_map_id(&view, group.first_id, i, &index); ++i) {
                kest_map_member member {};
                kest_map_member_at(&view, index, &member);
                members << text(member.name);
            }
            found = { QByteArray::number(group.gid), text(group.password), members.join(',') };
        }
        QTEST(result == KEST_MAP_FOUND ? found.join(' ') : QByteArray("missing"), "result");
    }

    // A cached account is answered from the map, its groups too; an unknown one is asked for once in the
    // negative time, and again after it. Within it the map answers, even while the daemon is frozen.
    void daemonRunning()
    {
        QCOMPARE(call("getpwnam", "@alice"), alice);
        QTRY_VERIFY(QFileInfo::exists(mapPath()));
        struct stat map;
        QCOMPARE(stat(QFile::encodeName(mapPath()).constData(), &map), 0);
        QCOMPARE(QList<uint>({ map.st_uid, map.st_mode & 07777 }), QList<uint>({ 0, 0644 }));
        QVERIFY(!m_s.root.readFile(QStringLiteral("/run/cache-kest.map")).contains("alice-password"));
        QVERIFY(m_s.server.clearRequests());
        QCOMPARE(call("getpwuid", "10001"), alice);
        QCOMPARE(call("initgroups", "@alice"), QByteArray("1 10000 27 7"));
        QCOMPARE(serverRequests(), 0);
        for (const QByteArray &unknown : { QByteArray("getpwnam @carol"), QByteArray("getpwuid 10099") }) {
            const QByteArray function = unknown.split(' ').at(0), key = unknown.split(' ').at(1);
            QVERIFY(m_s.server.clearRequests());
            QCOMPARE(call(function, key), QByteArray("0"));
            const int asked = serverRequests();
            QVERIFY(asked > 0);
            QTRY_VERIFY(mapSaysNo(key));
            QCOMPARE(kill(pid_t(m_s.daemon.processId()), SIGSTOP), 0);
            const QByteArray frozen = call(function, key);
            QCOMPARE(kill(pid_t(m_s.daemon.processId()), SIGCONT), 0);
            QCOMPARE(frozen, QByteArray("0"));
            QCOMPARE(serverRequests(), asked);
            QTest::qWait(2100);
            QCOMPARE(call(function, key), QByteArray("0"));
            QVERIFY(serverRequests() > asked);
        }
    }

    // The front service deletes a record file (and the server no longer knows the account): the map
    // loses it well within the stated bound.
    void removedByFrontService()
    {
        QCOMPARE(call("getpwnam", "@bob"), QByteArray("1 @bob:x:10002:10000:Bob:/home/bob:/bin/bash"));
        QJsonObject data = DomainServerFixture::defaultData();
        QJsonArray users = data.value(QLatin1String("users")).toArray();
        users.removeLast();
        data.insert(QStringLiteral("users"), users);
        QVERIFY(m_s.server.setData(data));
        QVERIFY(QFile::remove(m_s.root.workDir() + QStringLiteral("/10002")));
        QElapsedTimer timer;
        timer.start();
        QTRY_COMPARE_WITH_TIMEOUT(call("getpwuid", "10002"), QByteArray("0"), 2000);
        QVERIFY2(timer.elapsed() < 1000, qPrintable(QString::number(timer.elapsed())));
        QVERIFY(m_s.server.setData(DomainServerFixture::defaultData()));
    }

    void enableOffWithdrawsTheMap()
    {
        QVERIFY(writeSettings(false));
        QTRY_VERIFY_WITH_TIMEOUT(!QFileInfo::exists(mapPath()), 2000);
        QCOMPARE(call("getpwnam", "@alice"), QByteArray("0"));
        QVERIFY(writeSettings());
        QTRY_VERIFY_WITH_TIMEOUT(QFileInfo::exists(mapPath()), 2000);
        QCOMPARE(call("getpwnam", "@alice"), alice);
    }

    // With cache-kest stopped the last map answers; accounts it lacks are unavailable, its negative answers
    // too, and a map that is not root's own, writable by others or cut short is not trusted.
    void daemonStopped_data()
    {
        QTest::addColumn<QByteArray>("change"); // what is done to the map first
        QTest::addColumn<QByteArray>("command");
        QTest::addColumn<QByteArray>("result");
        QTest::newRow("answered no before the stop")
            << QByteArray() << QByteArray("getpwnam @nobody") << QByteArray("-1");
        QTest::newRow("cached, through glibc") << QByteArray() << QByteArray("getent passwd @alice 10001")
                                               << QByteArray("0 @alice:x:10001:10000:Alice:/home/alice:/bin/bash\n"
                                                             "@alice:x:10001:10000:Alice:/home/alice:/bin/bash\n");
        QTest::newRow("group, through glibc")
            << QByteArray() << QByteArray("getent group kest") << QByteArray("0 kest:x:10000:@alice,@bob\n");
        QTest::newRow("groups") << QByteArray() << QByteArray("initgroups @alice") << QByteArray("1");
        QTest::newRow("not in the map") << QByteArray() << QByteArray("getpwnam @bob") << QByteArray("-1");
        QTest::newRow("owned by another user")
            << QByteArray("chown") << QByteArray("getpwnam @alice") << QByteArray("-1");
        QTest::newRow("writable by group") << QByteArray("chmod") << QByteArray("getpwnam @alice") << QByteArray("-1");
        QTest::newRow("cut short") << QByteArray("cut") << QByteArray("getpwnam @alice") << QByteArray("-1");
    }

    void daemonStopped()
    {
        QFETCH(QByteArray, change);
        QFETCH(QByteArray, command);
        static QByteArray published;
        if (m_s.daemon.isRunning()) {
            QCOMPARE(call("getpwnam", "@nobody"), QByteArray("0"));
            QTRY_VERIFY(mapSaysNo("@nobody"));
            // Found running by the module just before it stops.
            QCOMPARE(call("getpwnam", "@nobody"), QByteArray("0"));
            QCOMPARE(m_s.daemon.stop(), 0);
            published = m_s.root.readFile(QStringLiteral("/run/cache-kest.map"));
        }
        const QByteArray path = QFile::encodeName(mapPath());
        QVERIFY(m_s.root.writeFile(
            QStringLiteral("/run/cache-kest.map"), change == "cut" ? published.left(published.size() / 2) : published));
        QCOMPARE(chmod(path.constData(), change == "chmod" ? 0664 : 0644), 0);
        QCOMPARE(chown(path.constData(), change == "chown" ? 65534 : 0, 0), 0);
        QByteArray result;
        if (!command.startsWith("getent ")) {
            result = call(command.split(' ').at(0), command.split(' ').at(1));
            result = result.left(result.indexOf(' ') < 0 ? result.size() : result.indexOf(' '));
        } else {
            result = WrappedCommand::run(QFile::encodeName(m_s.root.filePath(QStringLiteral("/wrapped"))), command);
        }
        QTEST(result, "result");
    }
};

QTEST_GUILESS_MAIN(AccountMapTest)
#include "test_accountmap.moc"
