#include "cachesetup.h"

#include <QJsonArray>
#include <QTest>

namespace
{
using Run = CacheDaemonFixture::Run;

Run status(const QStringList &more = {}, uint uid = 0)
{
    return CacheDaemonFixture::run(QStringList { QStringLiteral("--status") } + more, uid);
}
} // namespace

// What an administrator asks the running daemon: its state online, offline and switched off, in words and as
// JSON, and only what the asking user may see. A client key gone missing is an outage answered from the cache
// at once; a port that is none stops the daemon before it listens.
class DaemonStatusTest : public QObject
{
    Q_OBJECT
    CacheSetup s;

    QByteArray login() const { return s.login(QStringLiteral("@alice"), QStringLiteral("alice-password")); }

private Q_SLOTS:
    void initTestCase()
    {
        // Other users' clients find the daemon through its pid file, as on a machine.
        QVERIFY(QFile::setPermissions(s.root.filePath(QString()),
            QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ExeOwner | QFileDevice::ReadOther
                | QFileDevice::ExeOther));
        QVERIFY2(s.start(), qPrintable(s.errorText()));
        QTRY_COMPARE_WITH_TIMEOUT(status().status, 0, 15000);
        QCOMPARE(login(), QByteArray(R"({"pass":true})"));
    }

    void online()
    {
        const Run json = status({ QStringLiteral("--json") });
        QCOMPARE(json.status, 0);
        const QJsonObject state = json.json();
        const QJsonObject server { { QStringLiteral("address"), DomainServerFixture::address() },
            { QStringLiteral("port"), s.server.port() } };
        QCOMPARE(state.value(QLatin1String("server")).toObject(), server);
        QCOMPARE(state.value(QLatin1String("state")).toString(), QStringLiteral("online"));
        QVERIFY(state.value(QLatin1String("lastContact")).isString() && state.value(QLatin1String("since")).isString());
        QCOMPARE(state.value(QLatin1String("cachedAccounts")).toInt(), 1);
        const QJsonObject alice = state.value(QLatin1String("accounts")).toArray().at(0).toObject();
        QCOMPARE(alice.value(QLatin1String("name")).toString(), QStringLiteral("@alice"));
        QCOMPARE(alice.value(QLatin1String("home")).toString(), QStringLiteral("/home/alice"));
        QVERIFY(alice.value(QLatin1String("lastOnlineLogin")).isString());
        QCOMPARE(alice.value(QLatin1String("offlineLogin")).toObject().value(QLatin1String("allowed")), true);
        // Never the digest kept for offline logins.
        QVERIFY2(!json.out.contains("password") && !json.out.contains("3b6"), json.out);

        const Run text = status({ QStringLiteral("10001") });
        QCOMPARE(text.status, 0);
        for (const char *line : { "enabled:            yes\n", "state:              online since ",
                 "cached accounts:    1\n", "account:            @alice (uid 10001)\n",
                 "  offline login:    allowed until ", "  home:             /home/alice\n" })
            QVERIFY2(text.out.contains(line), text.out);
    }

    // Anyone sees the general state, a user their own account, nobody another's.
    void leastPrivilege()
    {
        const Run nobody = status({ QStringLiteral("--json") }, 65534);
        QCOMPARE(nobody.status, 0);
        QCOMPARE(nobody.json().value(QLatin1String("accounts")).toArray().size(), 0);
        QCOMPARE(nobody.json().value(QLatin1String("cachedAccounts")).toInt(), 1);
        const Run prying = status({ QStringLiteral("@alice") }, 65534);
        QCOMPARE(prying.status, 1);
        QCOMPARE(prying.err, QByteArray("permission denied !!!\n"));
        const Run own = status({ QStringLiteral("--json"), QStringLiteral("@alice") }, 10001);
        QCOMPARE(own.json().value(QLatin1String("accounts")).toArray().size(), 1);
    }

    // Without its key the client's outage (its own test's business) leaves logins to the cache; the status says
    // why it is offline.
    void missingClientKeyIsAnOutage()
    {
        const QString missing = s.server.filePath(QStringLiteral("gone.key"));
        QVERIFY(s.writeSettings({ { QStringLiteral("url/private-key"), missing } }));
        QCOMPARE(login(), QByteArray(R"({"pass":true})"));

        const Run json = status({ QStringLiteral("--json") });
        QCOMPARE(json.status, 1);
        QCOMPARE(json.json().value(QLatin1String("state")).toString(), QStringLiteral("offline"));
        QVERIFY2(json.json().value(QLatin1String("reason")).toString().contains(missing), json.out);
        QVERIFY2(status().out.contains("state:              offline since "), status().out);
        QVERIFY(s.writeSettings());
        QTRY_COMPARE_WITH_TIMEOUT(status().status, 0, 10000);
    }

    void disabledAndStopped()
    {
        QVERIFY(s.writeSettings({ { QStringLiteral("main/enable"), false } }));
        const Run text = status();
        QCOMPARE(text.status, 2);
        QVERIFY2(text.out.startsWith("enabled:            no\n"), text.out);
        QCOMPARE(status({ QStringLiteral("--json") }).json().value(QLatin1String("enabled")), false);
        QCOMPARE(s.daemon.stop(), 0);
        const Run stopped = status({ QStringLiteral("--json") });
        QCOMPARE(stopped.status, 2);
        QCOMPARE(stopped.out, QByteArray("{\"running\":false}\n"));
    }

    // Never a random port: the daemon names the key, the value and the file, and stops with a status of its own.
    void invalidPortStopsTheDaemon()
    {
        QVERIFY(s.writeSettings({ { QStringLiteral("main/port"), QStringLiteral("10o80") } }));
        const Run daemon = CacheDaemonFixture::run({});
        QCOMPARE(daemon.status, 3);
        QVERIFY2(daemon.err.contains("configuration error: [main] port: \"10o80\" is not a whole number in 1-65535 in "
                     + s.root.filePath(QStringLiteral("/etc/kest-iam.conf")).toUtf8()),
            daemon.err);
        const Run check = CacheDaemonFixture::run({ QStringLiteral("--check-config") });
        QCOMPARE(check.status, 2);
        QVERIFY2(check.out.contains(": error: [main] port: \"10o80\""), check.out);
    }
};

QTEST_GUILESS_MAIN(DaemonStatusTest)
#include "test_daemonstatus.moc"
