#include "blackhole.h"
#include "cachecontrolfactory.h"
#include "cachesetup.h"
#include "cachestore.h"
#include "rawconnection.h"
#include "testroot.h"
#include "userlistmanager.h"

#include <QDir>
#include <QElapsedTimer>
#include <QJsonDocument>
#include <QTcpServer>
#include <QTcpSocket>
#include <QTest>

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

namespace
{
const QByteArray passTrue = R"({"pass":true})";
const QByteArray passFalse = R"({"pass":false})";
const QByteArray resultOk = R"({"errorMessage":"","retVal":0})";

// Several replies compared at once; a braced list makes the calls in the order written.
using Replies = QByteArrayList;

QByteArray result(const char *message)
{
    return R"({"errorMessage":")" + QByteArray(message) + R"(","retVal":1})";
}

QByteArray status(int code, const char *message)
{
    return R"({"code":)" + QByteArray::number(code) + R"(,"data":null,"msg":")" + message + "\"}";
}

// What the command line prints, and its exit status, for a reply that reports a failure.
QByteArray failed(const QByteArray &reply)
{
    return "1 " + reply + "\nstderr: ";
}

QByteArray command(int number, const QJsonValue &data)
{
    return QJsonDocument(QJsonObject { { QStringLiteral("command"), number }, { QStringLiteral("data"), data } })
        .toJson(QJsonDocument::Compact);
}

// The command line's trimmed output when it ends with 0 and no error, else "<exit code> <output>stderr: <error>".
QByteArray run(const char *option, const char *argument)
{
    const CacheDaemonFixture::Run client
        = CacheDaemonFixture::run({ QLatin1String(option), QString::fromUtf8(argument) });
    if (client.status < 0)
        return "did not finish";
    return client.status == 0 && client.err.isEmpty()
        ? client.out.trimmed()
        : QByteArray::number(client.status) + ' ' + client.out + "stderr: " + client.err;
}

// A daemon in a fresh root beside a running domain server, with short names for its look-ups and logins.
struct Setup : CacheSetup {
    QByteArray lookUp(const char *name) const { return CacheSetup::lookUp(QLatin1String(name)); }
    QByteArray login(const char *name, const char *password) const
    {
        return CacheSetup::login(QLatin1String(name), QLatin1String(password));
    }
};
QByteArray errorReply(const char *text)
{
    return R"({"errorInfo":")" + QByteArray(text) + R"(","version":16777216})";
}
const QByteArray jsonError = errorReply("Error in JSON data !!!");
const QByteArray missingField
    = errorReply("The JSON field is missing. version, functionName and argv are required !!!");
// Expected in place of a reply: none within 400 ms, the connection closed, or the client going away itself.
const QByteArray noReply = "(none)", closed = "(closed)", vanish = "(vanish)";
quint16 unusedPort()
{
    QTcpServer probe;
    return probe.listen(QHostAddress(QStringLiteral("127.0.0.1"))) ? probe.serverPort() : 0;
}
// A port free at start: the daemon listens on it, and nothing answers there at 127.0.0.2.
quint16 freePort()
{
    static const quint16 port = unusedPort();
    return port;
}
QByteArray settings(bool enable = true, quint16 port = freePort())
{
    return "[main]\nenable=" + QByteArray(enable ? "true" : "false")
        + "\nip=127.0.0.2\nport=" + QByteArray::number(port) + "\nnetwork-timeout=1\n";
}
} // namespace

// systemd's end of Type=notify: a datagram socket at a path, handed over in NOTIFY_SOCKET.
class NotifySocket
{
public:
    explicit NotifySocket(const QString &path)
        : m_path(QFile::encodeName(path))
    {
        sockaddr_un address = {};
        address.sun_family = AF_UNIX;
        if (size_t(m_path.size()) >= sizeof(address.sun_path))
            return;
        memcpy(address.sun_path, m_path.constData(), size_t(m_path.size()));
        m_fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        if (m_fd >= 0 && bind(m_fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) != 0) {
            close(m_fd);
            m_fd = -1;
        }
    }
    ~NotifySocket()
    {
        if (m_fd >= 0)
            close(m_fd);
    }
    bool isValid() const { return m_fd >= 0; }
    QByteArray path() const { return m_path; }
    // The next message, or "(none)" when none comes within the time.
    QByteArray next(int milliseconds) const
    {
        pollfd ready = { m_fd, POLLIN, 0 };
        char message[512];
        if (poll(&ready, 1, milliseconds) != 1)
            return "(none)";
        const ssize_t length = recv(m_fd, message, sizeof(message), 0);
        return length < 0 ? QByteArray("(error)") : QByteArray(message, int(length));
    }

private:
    QByteArray m_path;
    int m_fd = -1;
};

// The real cache-kest: first its request server with the domain server out of reach, then against the test domain
// server the way the machine's modules use it, each of those checks with a daemon and server of its own.
class CacheDaemonTest : public QObject
{
    Q_OBJECT
    TestRoot m_root; // of the request server's daemon
    CacheDaemonFixture m_daemon;
    QScopedPointer<RawConnection> m_stale, m_idle;
    QElapsedTimer m_staleSince;
    QScopedPointer<Setup> s;

private Q_SLOTS:
    void initTestCase()
    {
        QVERIFY(m_root.writeSettings(settings()));
        QVERIFY2(m_daemon.start(), qPrintable(m_daemon.errorText()));
        m_stale.reset(new RawConnection(m_daemon.port()));
        m_stale->send(QByteArray::fromHex("00000010") + "{\"vers");
        m_staleSince.start();
        m_idle.reset(new RawConnection(m_daemon.port()));
    }

    void exchanges_data()
    {
        // Bytes to send, each followed by the reply expected next.
        QTest::addColumn<QByteArrayList>("steps");
        const auto frame = &CacheDaemonFixture::frame;
        const auto row = [frame](const char *name, const char *payload, const QByteArray &reply) {
            QTest::newRow(name) << QByteArrayList { frame(payload), reply };
        };
        row("not JSON", "hello", jsonError);
        row("JSON array", "[1,2]", jsonError);
        row("no version", R"({"functionName":"queryUid","argv":["1000"]})", missingField);
        row("two arguments for queryUid", R"({"version":1,"functionName":"queryUid","argv":["1000","x"]})",
            errorReply("Error in JSON argv array (all array members must be strings) !!!"));
        row("letter case", R"({"version":1,"functionName":"QueryUid","argv":["1000"]})",
            errorReply("Function name not defined !!!"));
        row("command wins", R"({"command":9,"data":{},"functionName":"queryUid","argv":["1"]})",
            result("invalid command!!!"));
        row("command without data", R"({"command":1})",
            result("The JSON field is missing. command and data are required !!!"));
        row("queryGid never served", R"({"version":1,"functionName":"queryGid","argv":["1000","{}"]})", passFalse);
        const QByteArray empty = frame("{}");
        QTest::newRow("empty frame waits for more bytes")
            << QByteArrayList { QByteArray(4, '\0'), noReply, empty, jsonError, QByteArray(1, ' '), missingField };
        QTest::newRow("split frame") << QByteArrayList { empty.left(3), noReply, empty.mid(3, 2), noReply, empty.mid(5),
            missingField };
        QTest::newRow("two frames in one segment, one per read")
            << QByteArrayList { frame("[]") + empty, jsonError, QByteArray(), noReply, frame("1"), missingField };
        QTest::newRow("frame above 1 MiB") << QByteArrayList { QByteArray::fromHex("00100001") + "{",
            errorReply("Frame too large !!!"), QByteArray(), closed };
        QTest::newRow("frame of 1 MiB") << QByteArrayList { frame(QByteArray(1024 * 1024, ' ')), jsonError };
        row("client gone before its answer", R"({"version":1,"functionName":"authenticatePassword","argv":["@a","p"]})",
            vanish);
    }

    void exchanges()
    {
        QFETCH(QByteArrayList, steps);
        RawConnection connection(m_daemon.port());
        for (int i = 0; i < steps.size(); i += 2) {
            connection.send(steps.at(i));
            const QByteArray &expected = steps.at(i + 1);
            if (expected == vanish)
                connection.abort();
            else if (expected == closed)
                QVERIFY(connection.closedWithin(5000));
            else
                QCOMPARE(
                    connection.reply(expected == noReply ? 400 : 20000), expected == noReply ? QByteArray() : expected);
        }
    }

    // No client, however it behaves, stops the server or closes another one's connection.
    void cleanup()
    {
        s.reset();
        QCOMPARE(m_daemon.call(QStringLiteral("queryUid"), { QStringLiteral("12") }), passFalse);
        QVERIFY(m_idle->isConnected() && m_daemon.isRunning());
    }

    // Switched off, the daemon says no even to requests it would otherwise answer or reject.
    void disabledAnswersFalse()
    {
        QVERIFY(m_root.writeSettings(settings(false)));
        const QByteArray replies = m_daemon.call(QStringLiteral("modifyUser"), { QStringLiteral("not json") })
            + m_daemon.call(QStringLiteral("listAccounts"), {});
        QVERIFY(m_root.writeSettings(settings()));
        QCOMPARE(replies, passFalse + passFalse);
    }

    // Before the slower checks: a frame left incomplete is closed after 30 s, an idle connection is not (cleanup).
    void staleFrameIsClosed()
    {
        QVERIFY(!m_stale->closedWithin(int(qMax<qint64>(0, 25000 - m_staleSince.elapsed()))));
        QVERIFY(m_stale->closedWithin(10000));
    }

    // Look-ups, logins and password changes while the server answers, then while its SYNs go unanswered. That the
    // daemon finds the server again once it is back is the demo's last step.
    void lookUpsLoginsAndChanges()
    {
        s.reset(new Setup);
        QVERIFY2(s->start(), qPrintable(s->errorText()));
        QCOMPARE(
            (Replies { s->lookUp("@alice"), s->lookUp("@bob"), s->lookUp("@nobody"), s->login("@alice", "wrong") }),
            (Replies { passTrue, passTrue, passFalse, passFalse }));
        QVERIFY(s->hasRecord(10001) && s->hasRecord(10002));
        QCOMPARE(readCacheRecord(10001)->password(), QStringLiteral("x"));
        QCOMPARE(s->login("@alice", "alice-password"), passTrue);
        QCOMPARE(readCacheRecord(10001)->password(), UserListManager::passwordDigest(QStringLiteral("alice-password")));
        // The name-service module's entry comes from the cache and never carries the digest.
        QCOMPARE(s->daemon.call(QStringLiteral("getAccountByName"), { QStringLiteral("@alice") }),
            R"({"pass":true,"user":{"gecos":"Alice","gid":10000,"home":"/home/alice","name":"@alice","shell":"/bin/bash","uid":10001}})");

        // Only a change the server accepted may replace the digest kept for offline logins (tried offline below);
        // malformed requests and local accounts go no further than the daemon.
        const auto change = [](const char *argument) { return run("--modify-user-passwd", argument); };
        QCOMPARE(change(R"({"username":"@alice","password":"new-pass","old_password":"guess"})"),
            failed(status(1, "old password is wrong")));
        QCOMPARE(change("{username"), failed(status(1, "json格式解析错误")));
        QCOMPARE(change(R"({"username":"@alice","password":"p"})"),
            failed(status(2, "请求消息缺少必要的字段,username,password,old_password")));
        QCOMPARE(change(R"({"username":"root","password":"new-pass","old_password":"b"})"),
            failed(status(3, "校验域账号失败,不能查询到此账户信息")));
        QCOMPARE(s->daemon.call(QStringLiteral("modifyUser"), { QStringLiteral("[]") }), status(1, "json解析失败"));
        QCOMPARE(s->daemon.call(QStringLiteral("modifyUser"), { QStringLiteral(R"({"username":"@alice"})") }),
            status(2, "json解析失败,缺少必要的字段"));

        // Answers come from the cache, and only the password the server took opens it; bob was looked up but
        // never logged in. How long the modules may wait is their own test's business.
        s->server.stop();
        Blackhole blackhole(DomainServerFixture::address(), s->server.port());
        QVERIFY(blackhole.isFull());
        QCOMPARE(change(R"({"username":"@alice","password":"new-pass","old_password":"alice-password"})"),
            failed(status(4, "网络错误,无法修改密码")));
        QCOMPARE((Replies { s->lookUp("@alice"), s->login("@alice", "alice-password"), s->login("@alice", "new-pass"),
                     s->login("@bob", "bob-password") }),
            (Replies { passTrue, passTrue, passFalse, passFalse }));
    }

    // A server that hands out a uid of the machine's own range is not believed: nothing is cached. What is
    // cached outlives the server: kept while it is away, refreshed once it is back. A server with an impostor's
    // certificate is an unreachable one (the client's test), so its refresh keeps the records just the same.
    void cacheOutlivesTheServer()
    {
        s.reset(new Setup);
        QVERIFY2(s->start(), qPrintable(s->errorText()));
        const QByteArray data = QJsonDocument(DomainServerFixture::defaultData()).toJson().replace("10001", "9999");
        QVERIFY(s->server.setData(QJsonDocument::fromJson(data).object()));
        QCOMPARE((Replies { s->lookUp("@alice"), s->login("@alice", "alice-password") }),
            (Replies { passFalse, passFalse }));
        // groups.txt comes from the start-up refresh, which may still be on its way.
        QTRY_COMPARE_WITH_TIMEOUT(
            QDir(s->root.workDir()).entryList(QDir::Files), QStringList { QStringLiteral("groups.txt") }, 5000);
        QVERIFY(s->server.setData(DomainServerFixture::defaultData()));

        QCOMPARE(s->login("@alice", "alice-password"), passTrue);
        s->daemon.stop();
        s->server.stop();
        CacheControlPtr ghost = createCacheControl();
        QVERIFY(cacheRecordFromJson(ghost, QStringLiteral(R"({"version":16777216,"uid":10099,"account":"@ghost"})"))
            && saveCacheRecord(*ghost));
        QVERIFY2(s->daemon.start(), qPrintable(s->daemon.errorText()));
        QTest::qWait(1500);
        QVERIFY(s->hasRecord(10099));
        QVERIFY(s->server.start(s->server.port()));
        QTRY_VERIFY_WITH_TIMEOUT(!s->hasRecord(10099), 15000);
        QVERIFY(s->hasRecord(10001));
    }

    // Root's commands change the cache and the policy; any other local user may only look up. Then the
    // daemon's life as the command line and a second daemon see it.
    void commandsAndLifecycle()
    {
        s.reset(new Setup);
        QVERIFY2(s->start(), qPrintable(s->errorText()));
        QCOMPARE((Replies { s->lookUp("@alice"), s->lookUp("@bob") }), (Replies { passTrue, passTrue }));
        const auto asRoot = [this](int n, const QJsonValue &data) { return s->daemon.request(command(n, data)); };
        const auto asNobody = [this](const QByteArray &request) { return s->daemon.requestAsUser(65534, request); };
        // The command line sends every argument as text: UpdateCache then reads uid 0, CleanCache a number as "".
        const QByteArray missing = result("[CleanCache] : cache file not exists!!!");
        QCOMPARE((Replies { run("--update-cache", "10001"), asRoot(3, 10001), run("--clean-cache", "10002") }),
            (Replies { failed(result("[UpdateCache] : cache file not exists!!!")), resultOk, resultOk }));
        QVERIFY(!s->hasRecord(10002));
        QCOMPARE(
            (Replies { run("--clean-cache", "10002"), asRoot(1, 10001), s->lookUp("@bob"),
                run("--clean-cache-not-in-list", R"({"whitelist":[10001,"10002"]})"), asRoot(2, QStringLiteral("{")) }),
            (Replies {
                failed(missing), missing, passTrue, resultOk, result("[CleanCacheNotInList] : json parse error!!!") }));
        QVERIFY(s->hasRecord(10001) && !s->hasRecord(10002));

        QCOMPARE(asRoot(4,
                     QStringLiteral(R"({"pw_strength":{"min_length":8,"strength":1},"pw_validity":{},)"
                                    R"("pw_history_check":{},"first_login":{},"offline_login":{"cache_validity":3}})")),
            resultOk);
        const QByteArray written = s->root.readFile(QStringLiteral("/etc/kest-iam.conf"));
        QVERIFY(written.contains("[pw_strength]\nmin_length=8\nstrength=true\n") && written.contains("cache_validity=3")
            && written.contains("enable=true"));
        QCOMPARE((Replies { asRoot(4, QStringLiteral(R"({"pw_strength":{}})")), asRoot(4, QStringLiteral("nope")) }),
            (Replies { result("[PasswordConfig] : pw-config json missing field,[pw_strength pw_validity "
                              "pw_history_check first_login offline_login]"),
                result("[PasswordConfig] : pw-config json parse error!!!") }));
        const QByteArray denied = result("permission denied !!!");
        QCOMPARE((Replies { asNobody(command(2, QStringLiteral(R"({"whitelist":[]})"))),
                     asNobody(command(4, QStringLiteral("{}"))),
                     asNobody(CacheDaemonFixture::functionCall(
                         QStringLiteral("queryAccountName"), { QStringLiteral("@alice") })) }),
            (Replies { denied, denied, passTrue }));

        QCOMPARE(run("--show-cache", "10001"),
            QByteArray(
                "uid: 10001\ngid: 10000\naccount: @alice\ndirectory: /home/alice\nshell: /bin/bash\ngecos: Alice"));
        QCOMPARE(run("--show-cache", "10009"), QByteArray("1 stderr: read cache file failed!!!\n"));
        // A second daemon cannot listen and leaves the first one's pid file alone; not root, it ends with 2.
        const QByteArray pid = s->root.readFile(QStringLiteral("/run/cache-kest.pid"));
        QCOMPARE(QProcess::execute(CacheDaemonFixture::programPath(), {}), 1);
        QCOMPARE(s->root.readFile(QStringLiteral("/run/cache-kest.pid")), pid);
        QCOMPARE(CacheDaemonFixture::run({}, 65534).status, 2);
        QCOMPARE(s->daemon.stop(), 0);
        QVERIFY(run("--clean-cache", "1").startsWith("1 stderr: cannot connect to cache-kest on 127.0.0.1:"));
    }

    // Password checks and changes are answered for root and the account itself only, and a refused call counts
    // nothing. Three wrong passwords lock the account without asking the server, across a restart too, until the
    // delay has passed.
    void passwordGuessingStops()
    {
        s.reset(new Setup);
        QVERIFY2(s->start(), qPrintable(s->errorText()));
        QVERIFY(s->writeSettings({ { QStringLiteral("main/failed-login-delay"), 4 } }));
        QCOMPARE(s->lookUp("@alice"), passTrue);
        const auto check = [](const char *password) {
            return CacheDaemonFixture::functionCall(
                QStringLiteral("authenticatePassword"), { QStringLiteral("@alice"), QLatin1String(password) });
        };
        const QString change
            = QStringLiteral(R"({"username":"@alice","password":"n","old_password":"alice-password"})");
        const QByteArray denied = status(1, "permission denied !!!");
        QElapsedTimer clock;
        clock.start();
        int guesses = 0, through = 0;
        for (; clock.elapsed() < 1000; ++guesses)
            through += s->daemon.requestAsUser(65534, check(guesses % 5 ? "wrong" : "alice-password")) == passTrue;
        qInfo("another uid: %d of %d guesses in 1 s got through", through, guesses);
        QCOMPARE(through, 0);
        QCOMPARE((Replies { s->daemon.requestAsUser(
                                65534, CacheDaemonFixture::functionCall(QStringLiteral("modifyUser"), { change })),
                     s->daemon.requestAsUser(65534, command(5, change)),
                     s->daemon.requestAsUser(10001, check("alice-password")) }),
            (Replies { denied, denied, passTrue }));

        QCOMPARE((Replies { s->login("@alice", "a"), s->login("@alice", "b"), s->login("@alice", "c") }),
            (Replies { passFalse, passFalse, passFalse }));
        QVERIFY(s->server.clearRequests());
        QVERIFY(s->login("@alice", "alice-password").startsWith(R"({"pass":false,"locked":)"));
        QCOMPARE(
            s->daemon.requestAsUser(10001, check("alice-password")).left(23), QByteArray(R"({"pass":false,"locked":)"));
        QCOMPARE(s->server.requests().size(), 0);
        QCOMPARE(s->daemon.stop(), 0);
        QVERIFY(s->daemon.start());
        QVERIFY(s->login("@alice", "alice-password").startsWith(R"({"pass":false,"locked":)"));
        QTRY_COMPARE_WITH_TIMEOUT(s->login("@alice", "alice-password"), passTrue, 8000);
    }

    // Ready means listening with the pid file written, since the modules find the port there; a daemon
    // that cannot listen never says ready.
    void tellsSystemdWhenReady()
    {
        TestRoot root;
        NotifySocket notify(root.filePath(QStringLiteral("/run/notify")));
        QVERIFY(notify.isValid() && root.writeSettings(settings(true, unusedPort())));
        QProcess daemon;
        QProcessEnvironment environment = QProcessEnvironment::systemEnvironment();
        environment.insert(QStringLiteral("NOTIFY_SOCKET"), QString::fromLocal8Bit(notify.path()));
        daemon.setProcessEnvironment(environment);
        daemon.start(CacheDaemonFixture::programPath(), QStringList());
        QVERIFY(daemon.waitForStarted());
        QCOMPARE(notify.next(15000), QByteArray("READY=1"));
        const QList<QByteArray> pidFile = root.readFile(QStringLiteral("/run/cache-kest.pid")).split('\n');
        QCOMPARE(pidFile.value(0).toLongLong(), daemon.processId());
        QTcpSocket client;
        client.connectToHost(QStringLiteral("127.0.0.1"), pidFile.value(1).toUShort());
        QVERIFY(client.waitForConnected(5000));
        daemon.terminate();
        QVERIFY(daemon.waitForFinished(10000));
        QCOMPARE(notify.next(1000), QByteArray("STOPPING=1"));

        QVERIFY(root.writeSettings("[main]\nport=" + QByteArray::number(m_daemon.port()) + '\n'));
        daemon.start(CacheDaemonFixture::programPath(), QStringList());
        QVERIFY(daemon.waitForFinished(10000));
        QCOMPARE(daemon.exitCode(), 1);
        QCOMPARE(notify.next(0), QByteArray("(none)"));
    }

    void cleanupTestCase()
    {
        QCOMPARE(m_daemon.stop(), 0);
        QVERIFY(!QFile::exists(m_root.filePath(QStringLiteral("/run/cache-kest.pid"))));
    }
};

QTEST_GUILESS_MAIN(CacheDaemonTest)
#include "test_cachedaemon.moc"
