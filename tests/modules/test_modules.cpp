#include "blackhole.h"
#include "cachesetup.h"
#include "domainserverfixture.h"
#include "loopbackpeer.h"
#include "nssmodule.h"
#include "wrappedcommand.h"

#include <QJsonDocument>
#include <QProcess>
#include <QTest>

// The modules as glibc and PAM load them: their contract with glibc against a stand-in daemon, then
// the real getent, id and pamtester against the real cache-kest and the test domain server.
class ModulesTest : public QObject
{
    Q_OBJECT
    NssModule m_nss;
    CacheSetup m_s;
    QScopedPointer<Blackhole> m_blackhole;

private Q_SLOTS:
    void initTestCase()
    {
        QVERIFY2(m_nss.isLoaded(), m_nss.errorText().constData());
        const QByteArray service = " required " + WrappedCommand::modulePath("pam_kest.so") + '\n';
        QVERIFY(m_s.root.writeFile(QStringLiteral("/wrapped/passwd"), "root:x:0:0:root:/root:/bin/bash\n"));
        QVERIFY(m_s.root.writeFile(QStringLiteral("/wrapped/group"), "root:x:0:\nsudo:x:27:\nlp:x:7:\n"));
        QVERIFY(m_s.root.writeFile(QStringLiteral("/wrapped/kest"),
            "auth" + service + "account" + service + "password" + service + "session" + service));
        QVERIFY(m_s.root.writeFile(QStringLiteral("/wrapped/other"), ""));
        QVERIFY2(m_s.start(), qPrintable(m_s.errorText()));
    }

    void nssContract_data()
    {
        QTest::addColumn<QByteArray>("call"); // function, key and the buffer's size when not 1024
        QTest::addColumn<QList<QByteArray>>("answers"); // framed; none: no daemon runs
        QTest::addColumn<QByteArray>("result"); // status, errno and entry
        QTest::addColumn<QByteArray>("asked"); // the function names the daemon was sent
        const auto row = [](const char *name, const char *call, const QList<QByteArray> &answers,
                             const QByteArray &result, const char *asked) {
            QTest::newRow(name) << QByteArray(call) << answers << result << QByteArray(asked);
        };
        const char aliceEntry[] = R"({"pass":true,"user":{"gecos":"Alice","gid":10000,"home":"/home/alice",)"
                                  R"("name":"@alice","shell":"/bin/bash","uid":10001}})";
        const auto frame = &CacheDaemonFixture::frame;
        const QByteArray entry = frame(aliceEntry), no = frame(R"({"pass":false})"), yes = frame(R"({"pass":true})");
        const QList<QByteArray> none;
        const QByteArray alice = "1 0 @alice:x:10001:10000:Alice:/home/alice:/bin/bash";
        row("local name: no connection", "getpwnam root", { entry }, "0 2", "");
        row("local uid: no connection", "getpwuid 9999", { entry }, "0 2", "");
        row("no daemon", "getpwnam @alice", none, "-1 2", "");
        row("buffer too small", "getpwnam @alice 30", { entry }, "-2 34", "getAccountByName");
        row("fetched first", "getpwuid 10001", { no, yes, entry }, alice, "getAccountByUid queryUid getAccountByUid");
        row("unknown", "getpwnam @carol", { no, no }, "0 2", "getAccountByName queryAccountName");
        row("entry of the wrong form", "getpwnam @alice",
            { frame(QByteArray(aliceEntry).replace("10001", "\"10001\"")) }, "-1 2", "getAccountByName");
        row("group", "getgrnam kest", none, "1 0 kest:x:10000:@alice,@bob", "");
        row("group, buffer too small", "getgrnam kest 32", none, "-2 34", "");
        row("group list", "initgroups @alice", none, "1 0 10000 27 5001", "");
        row("group list of a local name", "initgroups root", none, "0 2 10000", "");
    }

    void nssContract()
    {
        QFETCH(QByteArray, call);
        QFETCH(QList<QByteArray>, answers);
        TestRoot root;
        // A trailing comma and a line of three fields, as the daemon's writer may leave them.
        QVERIFY(root.writeFile(QStringLiteral("/var/lib/libkest-iam/groups.txt"),
            "sudo:x:27:admin,@alice\nkest:x:10000:@alice,@bob\nbroken:x:5000\nlpadmin:x:5001:@alice,\n"));
        LoopbackPeer standIn(answers);
        // The pid names a running cache-kest, the port the stand-in.
        if (!answers.isEmpty())
            QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"),
                QByteArray::number(m_s.daemon.processId()) + '\n' + QByteArray::number(standIn.port()) + '\n'));
        const QByteArrayList parts = call.split(' ');
        const QByteArray result = m_nss.call(parts.at(0), parts.at(1), parts.value(2, "1024").toUInt());
        QByteArrayList asked;
        for (const QByteArray &request : standIn.finish())
            asked.append(QJsonDocument::fromJson(request.mid(4))[QLatin1String("functionName")].toString().toUtf8());
        QTEST(asked.join(' '), "asked");
        QTEST(result, "result");
    }

    // A daemon found once is trusted while its pid file stays the same and its process lives, no longer:
    // after a restart the port is another, after a crash it could be anyone's.
    void foundDaemon()
    {
        TestRoot root;
        const QByteArray entry = CacheDaemonFixture::frame(
            R"({"pass":true,"user":{"gecos":"","gid":10000,"home":"/","name":"@alice","shell":"/bin/sh","uid":10001}})");
        LoopbackPeer first({ entry, entry }), second({ entry, entry });
        QProcess daemon;
        daemon.start(QStringLiteral("bash"), { QStringLiteral("-c"), QStringLiteral("exec -a cache-kest sleep 60") });
        const QByteArray pid = QByteArray::number(daemon.processId());
        QFile cmdline(QStringLiteral("/proc/%1/cmdline").arg(daemon.processId()));
        QVERIFY(QTest::qWaitFor([&] {
            const bool named = cmdline.open(QIODevice::ReadOnly) && cmdline.readAll().startsWith("cache-kest");
            cmdline.close();
            return named;
        }));
        // Port 0 leaves the pid file as it is.
        const auto lookUp = [&](quint16 port) {
            if (port != 0)
                root.writeFile(QStringLiteral("/run/cache-kest.pid"), pid + '\n' + QByteArray::number(port) + '\n');
            return nss_status(m_nss.call("getpwnam", "@alice").split(' ').at(0).toInt());
        };
        QCOMPARE(lookUp(first.port()), NSS_STATUS_SUCCESS);
        QCOMPARE(lookUp(second.port()), NSS_STATUS_SUCCESS);
        daemon.kill();
        daemon.waitForFinished();
        QCOMPARE(lookUp(0), NSS_STATUS_UNAVAIL);
        QCOMPARE(QList<int>({ first.finish().size(), second.finish().size() }), QList<int>({ 1, 1 }));
    }

    void glibcAndPam_data()
    {
        // 0: all up, 1: the domain server's SYNs dropped (cache-kest restarted), 2: cache-kest stopped
        QTest::addColumn<int>("stage");
        QTest::addColumn<QByteArray>("command");
        QTest::addColumn<QByteArray>("result"); // exit code and output
        const auto row = [](const char *name, int stage, const char *command, int exitCode, const QByteArray &output) {
            QTest::newRow(name) << stage << QByteArray(command) << QByteArray::number(exitCode) + ' ' + output;
        };
        const QByteArray alice = "@alice:x:10001:10000:Alice:/home/alice:/bin/bash\n";
        const QByteArray root = "root:x:0:0:root:/root:/bin/bash\n";
        const QByteArray granted = "Password: pamtester: successfully authenticated\n";
        const QByteArray unknown = "pamtester: User not known to the underlying authentication module\n";
        const QByteArray change = "Current password: New password: Retype new password: ";
        row("uid", 0, "getent passwd 10002", 0, "@bob:x:10002:10000:Bob:/home/bob:/bin/bash\n");
        // This id walks the group list, which shows the special groups to system services only.
        row("id", 0, "id @alice", 0, "uid=10001(@alice) gid=10000(kest) groups=10000(kest)\n");
        row("id as the accounts daemon", 0, "exec -a accounts-daemon id @alice", 0,
            "uid=10001(@alice) gid=10000(kest) groups=10000(kest),27(sudo),7(lp)\n");
        row("listing", 0, "getent passwd", 0, root);
        row("listing as the accounts daemon", 0, "exec -a accounts-daemon getent passwd", 0,
            root + alice + "@bob:x:10002:10000:Bob:/home/bob:/bin/bash\n");
        row("login", 0, "echo alice-password | pamtester kest @alice authenticate", 0, granted);
        row("wrong password", 0, "echo guess | pamtester kest @alice authenticate", 1,
            "Password: pamtester: Authentication failure\n");
        row("local name", 0, "pamtester kest root authenticate", 1, unknown);
        row("account", 0, "pamtester kest @alice acct_mgmt", 0, "pamtester: account management done.\n");
        row("account unknown", 0, "pamtester kest @nobody acct_mgmt", 1, unknown);
        // A module that only ignores leaves the stack without a decision, which PAM refuses.
        row("session", 0, "pamtester kest @alice open_session close_session", 0,
            "pamtester: successfully opened a session\npamtester: session has successfully been closed.\n");
        row("session, local name", 0, "pamtester kest root open_session", 1, "pamtester: Permission denied\n");
        row("change, wrong old password", 0,
            "printf 'guess\\nnew-pass\\nnew-pass\\n' | pamtester kest @alice chauthtok", 1,
            change + "old password is wrong\npamtester: Authentication token manipulation error\n");
        row("change", 0, "printf 'alice-password\\nnew-pass\\nnew-pass\\n' | pamtester kest @alice chauthtok", 0,
            change + "pamtester: authentication token altered successfully.\n");
        // Each answer before the modules' 5 s receive time-out; the first one waits on the silent server.
        // The login takes the digest the change left behind.
        row("blackholed: unknown", 1, "getent passwd @carol", 2, "");
        row("blackholed: login", 1, "echo new-pass | pamtester kest @alice authenticate", 0, granted);
        row("no daemon: login", 2, "echo new-pass | pamtester kest @alice authenticate", 1,
            "pamtester: Authentication service cannot retrieve authentication info\n");
    }

    void glibcAndPam()
    {
        QFETCH(int, stage);
        QFETCH(QByteArray, command);
        if (stage == 1 && !m_blackhole) {
            m_s.server.stop();
            m_s.daemon.stop();
            m_blackhole.reset(new Blackhole(DomainServerFixture::address(), m_s.server.port()));
            QVERIFY(m_blackhole->isFull());
            QVERIFY2(m_s.daemon.start(), qPrintable(m_s.daemon.errorText()));
        }
        if (stage == 2)
            m_s.daemon.stop();
        QTEST(WrappedCommand::run(QFile::encodeName(m_s.root.filePath(QStringLiteral("/wrapped"))), command), "result");
    }
};

QTEST_GUILESS_MAIN(ModulesTest)
#include "test_modules.moc"
