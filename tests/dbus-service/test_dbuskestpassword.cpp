#include "cachedaemonfixture.h"
#include "domainserverfixture.h"
#include "privatebus.h"
#include "serviceprocess.h"
#include "testaccounts.h"
#include "testroot.h"

#include <QDBusReply>
#include <QJsonDocument>
#include <QJsonObject>
#include <QTest>

namespace
{
const QByteArray passTrue("{\"pass\":true}");

QJsonObject jsonOf(const QString &text)
{
    return QJsonDocument::fromJson(text.toUtf8()).object();
}
} // namespace

// A password change from the bus to the domain server: dbus-kest runs the real cache-kest client, which asks
// the running cache daemon, which asks the test domain server.
class DBusKestPasswordTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        QVERIFY2(m_bus.isRunning(), qPrintable(m_bus.errorText()));
        m_connection = QDBusConnection::connectToBus(m_bus.address(), QStringLiteral("password-test"));
        QVERIFY(m_root.isValid());
        QVERIFY2(m_server.isValid() && m_server.start(), qPrintable(m_server.errorText()));
        QVERIFY(m_root.writeSettings(m_server.settingsIni(
            { { QStringLiteral("main/enable"), true }, { QStringLiteral("main/network-timeout"), 2 } })));
        QVERIFY2(m_daemon.start(), qPrintable(m_daemon.errorText()));
        // The first login makes @alice a cached user of this machine.
        QCOMPARE(login(QStringLiteral("alice-password")), passTrue);

        m_service.setSearchPath(
            qEnvironmentVariable("KEST_TEST_BINARY_DIR") + QStringLiteral("/src/cache:/usr/bin:/bin"));
        QVERIFY(m_service.start());
        QVERIFY(m_service.waitUntilServing(m_connection));
    }

    void cleanupTestCase()
    {
        QVERIFY(m_service.stop());
        QDBusConnection::disconnectFromBus(QStringLiteral("password-test"));
    }

    void changeThroughTheBus_data()
    {
        QTest::addColumn<QString>("oldPassword");
        QTest::addColumn<QString>("newPassword");
        QTest::addColumn<int>("code");
        QTest::addColumn<QString>("passwordAfter");

        QTest::newRow("wrong old password")
            << QStringLiteral("guess") << QStringLiteral("new-pass") << 1 << QStringLiteral("alice-password");
        QTest::newRow("changed") << QStringLiteral("alice-password") << QStringLiteral("new-pass") << 0
                                 << QStringLiteral("new-pass");
    }

    void changeThroughTheBus()
    {
        QFETCH(QString, oldPassword);
        QFETCH(QString, newPassword);
        QFETCH(int, code);
        QFETCH(QString, passwordAfter);
        QVERIFY(m_server.clearRequests());

        const QDBusReply<QString> reply = callService(
            m_connection, QStringLiteral("ModifyUserPassword"), { QStringLiteral("@alice"), oldPassword, newPassword });
        QVERIFY2(reply.isValid(), qPrintable(reply.error().message()));
        // The client's own output, newline included.
        QVERIFY2(reply.value().endsWith(QLatin1Char('\n')), qPrintable(reply.value()));
        QCOMPARE(jsonOf(reply.value()).value(QLatin1String("code")).toInt(-1), code);

        const QList<QJsonObject> requests = m_server.requests();
        QVERIFY(!requests.isEmpty());
        const QJsonObject change = requests.constFirst();
        QCOMPARE(change.value(QLatin1String("path")).toString(), QStringLiteral("/v3/client/reset_password"));
        const QJsonObject body = jsonOf(change.value(QLatin1String("body")).toString());
        QCOMPARE(body.value(QLatin1String("username")).toString(), QStringLiteral("@alice"));
        QCOMPARE(body.value(QLatin1String("password")).toString(), newPassword);
        QCOMPARE(body.value(QLatin1String("old_password")).toString(), oldPassword);

        QCOMPARE(login(passwordAfter), passTrue);
    }

private:
    QByteArray login(const QString &password) const
    {
        return m_daemon.call(QStringLiteral("authenticatePassword"), { QStringLiteral("@alice"), password });
    }

    PrivateBus m_bus;
    TestRoot m_root;
    QDBusConnection m_connection { QString() };
    DomainServerFixture m_server;
    CacheDaemonFixture m_daemon;
    ServiceProcess m_service;
};

QTEST_GUILESS_MAIN(DBusKestPasswordTest)
#include "test_dbuskestpassword.moc"
