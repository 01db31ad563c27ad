#include "blackhole.h"
#include "cachedaemonfixture.h"
#include "domainserverfixture.h"
#include "loopbackpeer.h"
#include "testroot.h"

#include <QJsonDocument>
#include <QJsonObject>
#include <QProcess>
#include <QTest>

#include <dlfcn.h>
#include <grp.h>
#include <nss.h>
#include <pwd.h>
#include <unistd.h>

namespace
{
QString modulePath(const char *name)
{
    return qEnvironmentVariable("KEST_TEST_BINARY_DIR") + QStringLiteral("/src/modules/") + QLatin1String(name);
}

const char aliceEntry[]
    = R"({"pass":true,"user":{"gecos":"Alice","gid":10000,"home":"/home/alice","name":"@alice","shell":"/bin/bash","uid":10001}})";

// The function names a stand-in daemon was asked for, once nobody can ask any more.
QByteArray askedOf(LoopbackPeer &peer)
{
    QList<QByteArray> names;
    for (const QByteArray &request : peer.finish())
        names.append(
            QJsonDocument::fromJson(request.mid(4)).object().value(QLatin1String("functionName")).toString().toUtf8());
    return names.join(' ');
}

template<typename Function> Function symbol(void *module, const char *name)
{
    return reinterpret_cast<Function>(dlsym(module, name));
}
} // namespace

// The modules as glibc and PAM load them: their contract with glibc against a stand-in daemon, then
// the real getent, id and pamtester against the real cache-kest and the test domain server.
class ModulesTest : public QObject
{
    Q_OBJECT
    void *m_nss = nullptr;
    QProcess m_namedCacheKest;
    QScopedPointer<TestRoot> m_root;
    QScopedPointer<DomainServerFixture> m_server;
    QScopedPointer<CacheDaemonFixture> m_daemon;
    QScopedPointer<Blackhole> m_blackhole;

    // "status errno entry" of one call into the module, the entry as a passwd or group line or a gid list.
    QByteArray callNss(const QByteArray &call, const QByteArray &key, int bufferSize)
    {
        QByteArray buffer(bufferSize, '\0');
        int error = 0;
        QByteArray entry;
        int status;
        if (call == "getpwnam" || call == "getpwuid") {
            passwd pwd {};
            status = call == "getpwnam"
                ? symbol<nss_status (*)(const char *, passwd *, char *, size_t, int *)>(m_nss, "_nss_kest_getpwnam_r")(
                    key.constData(), &pwd, buffer.data(), size_t(bufferSize), &error)
                : symbol<nss_status (*)(uid_t, passwd *, char *, size_t, int *)>(m_nss, "_nss_kest_getpwuid_r")(
                    key.toUInt(), &pwd, buffer.data(), size_t(bufferSize), &error);
            if (status == NSS_STATUS_SUCCESS)
                entry = QString::asprintf("%s:%s:%u:%u:%s:%s:%s", pwd.pw_name, pwd.pw_passwd, pwd.pw_uid, pwd.pw_gid,
                    pwd.pw_gecos, pwd.pw_dir, pwd.pw_shell)
                            .toUtf8();
        } else if (call == "getgrnam") {
            group grp {};
            status = symbol<nss_status (*)(const char *, group *, char *, size_t, int *)>(
                m_nss, "_nss_kest_getgrnam_r")(key.constData(), &grp, buffer.data(), size_t(bufferSize), &error);
            if (status == NSS_STATUS_SUCCESS) {
                QList<QByteArray> members;
                for (char **member = grp.gr_mem; *member; ++member)
                    members.append(*member);
                entry = QString::asprintf("%s:%s:%u:", grp.gr_name, grp.gr_passwd, grp.gr_gid).toUtf8()
                    + members.join(',');
            }
        } else {
            long start = 1, size = 1;
            auto *groups = static_cast<gid_t *>(malloc(sizeof(gid_t)));
            groups[0] = 10000;
            status = symbol<nss_status (*)(const char *, gid_t, long *, long *, gid_t **, long, int *)>(
                m_nss, "_nss_kest_initgroups_dyn")(key.constData(), 10000, &start, &size, &groups, 0, &error);
            for (long i = 0; i < start; ++i)
                entry += QByteArray::number(groups[i]) + ' ';
            free(groups);
        }
        return (QByteArray::number(status) + ' ' + QByteArray::number(error) + ' ' + entry).trimmed();
    }

    // One command line under the wrappers: the machine's own passwd, group and PAM files are never read.
    QByteArray run(const QByteArray &command, const QByteArray &input, int *exitCode)
    {
        QProcessEnvironment environment = QProcessEnvironment::systemEnvironment();
        // One wrapper per program: under the sanitizer's runtime the two together bind libc deeply.
        const QString wrapper
            = QLatin1String(command.startsWith("pamtester") ? "libpam_wrapper.so" : "libnss_wrapper.so");
        const QString preload = qEnvironmentVariable("KEST_MODULE_PRELOAD");
        environment.insert(
            QStringLiteral("LD_PRELOAD"), preload.isEmpty() ? wrapper : preload + QLatin1Char(' ') + wrapper);
        const QString files = m_root->filePath(QStringLiteral("/wrapped"));
        const QMap<QString, QString> variables {
            { QStringLiteral("NSS_WRAPPER_PASSWD"), files + QStringLiteral("/passwd") },
            { QStringLiteral("NSS_WRAPPER_GROUP"), files + QStringLiteral("/group") },
            { QStringLiteral("NSS_WRAPPER_MODULE_SO_PATH"), modulePath("libnss_kest.so.2") },
            { QStringLiteral("NSS_WRAPPER_MODULE_FN_PREFIX"), QStringLiteral("kest") },
            { QStringLiteral("NSS_WRAPPER_DISABLE_DEEPBIND"), preload.isEmpty() ? QString() : QStringLiteral("1") },
            { QStringLiteral("PAM_WRAPPER"), QStringLiteral("1") }, { QStringLiteral("PAM_WRAPPER_SERVICE_DIR"), files }
        };
        for (auto variable = variables.begin(); variable != variables.end(); ++variable)
            environment.insert(variable.key(), variable.value());
        QProcess process;
        process.setProcessEnvironment(environment);
        process.setProcessChannelMode(QProcess::MergedChannels);
        process.start(QStringLiteral("bash"), { QStringLiteral("-c"), QString::fromUtf8(command) });
        process.write(input);
        process.closeWriteChannel();
        *exitCode = process.waitForFinished(30000) ? process.exitCode() : -1;
        return process.readAll();
    }

private Q_SLOTS:
    void initTestCase()
    {
        m_nss = dlopen(QFile::encodeName(modulePath("libnss_kest.so.2")).constData(), RTLD_NOW | RTLD_LOCAL);
        QVERIFY2(m_nss, dlerror());
        // Whose first argument ends in cache-kest: what the module takes for a running daemon.
        m_namedCacheKest.start(
            QStringLiteral("bash"), { QStringLiteral("-c"), QStringLiteral("exec -a cache-kest sleep 600") });
        QVERIFY(m_namedCacheKest.waitForStarted());
        const auto renamed = [pid = m_namedCacheKest.processId()] {
            QFile cmdline(QStringLiteral("/proc/%1/cmdline").arg(pid));
            return cmdline.open(QIODevice::ReadOnly) && cmdline.readAll().startsWith("cache-kest");
        };
        QTRY_VERIFY(renamed());
    }

    void cleanupTestCase()
    {
        m_daemon.reset();
        m_server.reset();
        m_root.reset();
        m_namedCacheKest.kill();
        m_namedCacheKest.waitForFinished();
    }

    void nssContract_data()
    {
        QTest::addColumn<QByteArray>("call");
        QTest::addColumn<QByteArray>("key");
        QTest::addColumn<int>("bufferSize");
        QTest::addColumn<QList<QByteArray>>("answers"); // empty: no daemon runs
        QTest::addColumn<QByteArray>("result"); // status, errno and entry
        QTest::addColumn<QByteArray>("asked"); // the function names the daemon was sent
        const auto row = [](const char *name, const char *call, const char *key, int size,
                             const QList<QByteArray> &answers, const QByteArray &result, const char *asked) {
            QTest::newRow(name) << QByteArray(call) << QByteArray(key) << size << answers << result
                                << QByteArray(asked);
        };
        const QList<QByteArray> cached { aliceEntry }, none;
        const QByteArray no = R"({"pass":false})", yes = R"({"pass":true})",
                         wrongForm = QByteArray(aliceEntry).replace("10001", "\"10001\"");
        const QByteArray alice = "1 0 @alice:x:10001:10000:Alice:/home/alice:/bin/bash";
        row("local name: no connection", "getpwnam", "root", 1024, cached, "0 2", "");
        row("local uid: no connection", "getpwuid", "9999", 1024, cached, "0 2", "");
        row("no daemon", "getpwnam", "@alice", 1024, none, "-1 2", "");
        row("cached", "getpwnam", "@alice", 1024, cached, alice, "getAccountByName");
        row("buffer too small", "getpwnam", "@alice", 30, cached, "-2 34", "getAccountByName");
        row("fetched first", "getpwuid", "10001", 1024, { no, yes, aliceEntry }, alice,
            "getAccountByUid queryUid getAccountByUid");
        row("unknown", "getpwnam", "@carol", 1024, { no, no }, "0 2", "getAccountByName queryAccountName");
        row("entry of the wrong form", "getpwnam", "@alice", 1024, { wrongForm }, "-1 2", "getAccountByName");
        row("group", "getgrnam", "kest", 1024, none, "1 0 kest:x:10000:@alice,@bob", "");
        row("group, buffer too small", "getgrnam", "kest", 32, none, "-2 34", "");
        row("group list", "initgroups", "@alice", 0, none, "1 0 10000 27 5001", "");
        row("group list of a local name", "initgroups", "root", 0, none, "0 2 10000", "");
    }

    void nssContract()
    {
        QFETCH(QByteArray, call);
        QFETCH(QByteArray, key);
        QFETCH(int, bufferSize);
        QFETCH(QList<QByteArray>, answers);
        TestRoot root;
        // A trailing comma and a line of three fields, as the daemon's writer may leave them.
        QVERIFY(root.writeFile(QStringLiteral("/var/lib/libkest-iam/groups.txt"),
            "sudo:x:27:admin,@alice\nkest:x:10000:@alice,@bob\nbroken:x:5000\nlpadmin:x:5001:@alice,\n"));
        QList<QByteArray> framed;
        for (const QByteArray &answer : answers)
            framed.append(CacheDaemonFixture::frame(answer));
        LoopbackPeer standIn(framed);
        if (!answers.isEmpty())
            QVERIFY(root.writeFile(QStringLiteral("/run/cache-kest.pid"),
                QByteArray::number(m_namedCacheKest.processId()) + '\n' + QByteArray::number(standIn.port()) + '\n'));
        const QByteArray result = callNss(call, key, bufferSize);
        QTEST(askedOf(standIn), "asked");
        QTEST(result, "result");
    }

    void glibcAndPam_data()
    {
        // 0: all up, 1: domain server stopped, 2: its SYNs dropped (cache-kest restarted), 3: cache-kest stopped
        QTest::addColumn<int>("stage");
        QTest::addColumn<QByteArray>("command");
        QTest::addColumn<QByteArray>("input");
        QTest::addColumn<int>("exitCode");
        QTest::addColumn<QByteArray>("output");
        const auto row = [](const char *name, int stage, const char *command, const char *input, int exitCode,
                             const QByteArray &output) {
            QTest::newRow(name) << stage << QByteArray(command) << QByteArray(input) << exitCode << output;
        };
        const QByteArray alice = "@alice:x:10001:10000:Alice:/home/alice:/bin/bash\n";
        const QByteArray bob = "@bob:x:10002:10000:Bob:/home/bob:/bin/bash\n";
        const QByteArray root = "root:x:0:0:root:/root:/bin/bash\n";
        const QByteArray granted = "Password: pamtester: successfully authenticated\n";
        const QByteArray refused = "Password: pamtester: Authentication failure\n";
        const QByteArray unknown = "pamtester: User not known to the underlying authentication module\n";
        const QByteArray change = "Current password: New password: Retype new password: ";
        const QByteArray unchanged = "pamtester: Authentication token manipulation error\n";
        row("name", 0, "getent passwd @alice", "", 0, alice);
        row("uid", 0, "getent passwd 10002", "", 0, bob);
        row("unknown", 0, "getent passwd @nobody", "", 2, "");
        row("group", 0, "getent group kest", "", 0, "kest:x:10000:@alice,@bob\n");
        // This id walks the group list, which shows the special groups to system services only.
        row("id", 0, "id @alice", "", 0, "uid=10001(@alice) gid=10000(kest) groups=10000(kest)\n");
        row("id as the accounts daemon", 0, "exec -a accounts-daemon id @alice", "", 0,
            "uid=10001(@alice) gid=10000(kest) groups=10000(kest),27(sudo),7(lp)\n");
        row("listing", 0, "getent passwd", "", 0, root);
        row("listing as the accounts daemon", 0, "exec -a accounts-daemon getent passwd", "", 0, root + alice + bob);
        row("login", 0, "pamtester kest @alice authenticate", "alice-password\n", 0, granted);
        row("wrong password", 0, "pamtester kest @alice authenticate", "guess\n", 1, refused);
        row("local name", 0, "pamtester kest root authenticate", "", 1, unknown);
        row("account", 0, "pamtester kest @alice acct_mgmt", "", 0, "pamtester: account management done.\n");
        row("account unknown", 0, "pamtester kest @nobody acct_mgmt", "", 1, unknown);
        row("change, wrong old password", 0, "pamtester kest @alice chauthtok", "guess\nnew-pass\nnew-pass\n", 1,
            change + "old password is wrong\n" + unchanged);
        row("change", 0, "pamtester kest @alice chauthtok", "alice-password\nnew-pass\nnew-pass\n", 0,
            change + "pamtester: authentication token altered successfully.\n");
        row("login, new password", 0, "pamtester kest @alice authenticate", "new-pass\n", 0, granted);
        row("offline: name", 1, "getent passwd @alice", "", 0, alice);
        row("offline: unknown", 1, "getent passwd @carol", "", 2, "");
        row("offline: login", 1, "pamtester kest @alice authenticate", "new-pass\n", 0, granted);
        row("offline: wrong password", 1, "pamtester kest @alice authenticate", "guess\n", 1, refused);
        row("offline: change", 1, "pamtester kest @alice chauthtok", "new-pass\nn\nn\n", 1,
            change + "网络错误,无法修改密码\n" + unchanged);
        // Each answer before the modules' 5 s receive time-out; the first one waits on the silent server.
        row("blackholed: unknown", 2, "getent passwd @carol", "", 2, "");
        row("blackholed: login", 2, "pamtester kest @alice authenticate", "new-pass\n", 0, granted);
        row("blackholed: name", 2, "getent passwd @alice", "", 0, alice);
        row("no daemon: name", 3, "getent passwd @alice", "", 2, "");
        row("no daemon: login", 3, "pamtester kest @alice authenticate", "new-pass\n", 1,
            "pamtester: Authentication service cannot retrieve authentication info\n");
    }

    void glibcAndPam()
    {
        QFETCH(int, stage);
        QFETCH(QByteArray, command);
        QFETCH(QByteArray, input);
        if (!m_daemon) {
            m_root.reset(new TestRoot);
            m_server.reset(new DomainServerFixture);
            m_daemon.reset(new CacheDaemonFixture);
            const QByteArray service = ' ' + QFile::encodeName(modulePath("pam_kest.so")) + '\n';
            QVERIFY(m_server->isValid() && m_server->start());
            QVERIFY(m_root->writeSettings(m_server->settingsIni(
                { { QStringLiteral("main/enable"), true }, { QStringLiteral("offline_login/enable"), true },
                    { QStringLiteral("offline_login/cache_validity"), 1 } })));
            QVERIFY(m_root->writeFile(QStringLiteral("/wrapped/passwd"), "root:x:0:0:root:/root:/bin/bash\n"));
            QVERIFY(m_root->writeFile(QStringLiteral("/wrapped/group"), "root:x:0:\nsudo:x:27:\nlp:x:7:\n"));
            QVERIFY(m_root->writeFile(QStringLiteral("/wrapped/kest"),
                "auth required" + service + "account required" + service + "password required" + service
                    + "session required" + service));
            QVERIFY(m_root->writeFile(QStringLiteral("/wrapped/other"), ""));
            QVERIFY2(m_daemon->start(), qPrintable(m_daemon->errorText()));
        }
        if (stage >= 1)
            m_server->stop();
        if (stage == 2 && !m_blackhole) {
            m_daemon->stop();
            m_blackhole.reset(new Blackhole(DomainServerFixture::address(), m_server->port()));
            QVERIFY(m_blackhole->isFull());
            QVERIFY2(m_daemon->start(), qPrintable(m_daemon->errorText()));
        }
        if (stage >= 3)
            m_daemon->stop();
        int exitCode = -1;
        const QByteArray output = run(command, input, &exitCode);
        QTEST(output, "output");
        QTEST(exitCode, "exitCode");
    }
};

QTEST_GUILESS_MAIN(ModulesTest)
#include "test_modules.moc"
