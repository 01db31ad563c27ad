#include "domainserverfixture.h"
#include "httphelper.h"
#include "messagehandler.h"
#include "test_httpsupport.h"
#include "testroot.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QTest>

#include <functional>
#include <memory>

using HttpTestSupport::warningMismatch;

namespace
{
using Operation = std::function<QString(HttpHelper &)>;

const QString refused = QStringLiteral(R"({"code": -1,"msg": "web server refuse login."})");
const QString unreachable = QStringLiteral(R"({"code": -2,"msg": "client cannot connect to server."})");
const QString unknownAccount = QStringLiteral(R"({"code": -3,"msg": "network account does not exist."})");

const char aliceReply[] = R"({"code":0,"data":{"user":{"gecos":"Alice","home":"/home/alice","name":"@alice",)"
                          R"("password":"x","permissions":["sudo","lp"],"primary_group":{"id":10000,"name":"kest"},)"
                          R"("shell":"/bin/bash","uid":10001}},"msg":"ok"})";

struct OperationCase {
    const char *name;
    Operation operation;
    const char *path;
};

// One call of every operation, with the path it must use.
QList<OperationCase> everyOperation()
{
    return {
        { "queryUserByName", [](HttpHelper &h) { return h.queryUserByName(QStringLiteral("@alice")); },
            "/v3/account/" },
        { "queryUserByUid", [](HttpHelper &h) { return h.queryUserByUid(10001); }, "/v3/account/" },
        { "authenticate",
            [](HttpHelper &h) {
                return h.authenticate(
                    QStringLiteral("@alice"), QStringLiteral("alice-password"), QStringLiteral("password"));
            },
            "/v1/auth/" },
        { "queryGroupByName", [](HttpHelper &h) { return h.queryGroupByName(QStringLiteral("kest")); }, "/v3/group/" },
        { "queryGroupByGid", [](HttpHelper &h) { return h.queryGroupByGid(10000); }, "/v3/group/" },
        { "resetPassword",
            [](HttpHelper &h) {
                return h.resetPassword(
                    10001, QStringLiteral("@alice"), QStringLiteral("n"), QStringLiteral("alice-password"));
            },
            "/v3/client/reset_password" },
        { "queryDomain", [](HttpHelper &h) { return h.queryDomain(); }, "/v1/domain/" },
    };
}
} // namespace

Q_DECLARE_METATYPE(Operation)

class HttpOperationsTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        qInstallMessageHandler(messageHandler);
        m_server = std::make_unique<DomainServerFixture>();
        QVERIFY2(m_server->isValid(), qPrintable(m_server->errorText()));
        QVERIFY2(m_server->start(), qPrintable(m_server->errorText()));
    }

    void init()
    {
        m_root = std::make_unique<TestRoot>();
        QVERIFY(m_root->isValid());
        QVERIFY(m_root->writeFile(QStringLiteral("/usr/share/kest/machine.txt"), "machine-1\n"));
        if (!m_server->isRunning())
            QVERIFY2(m_server->restart(), qPrintable(m_server->errorText()));
        QVERIFY(m_server->setData(DomainServerFixture::defaultData()));
        QVERIFY(m_server->clearMisbehaviour());
        QVERIFY(m_server->clearRequests());
        SyslogCapture::clear();
    }

    void cleanup() { m_root.reset(); }

    void operations_data()
    {
        QTest::addColumn<Operation>("operation");
        QTest::addColumn<QString>("method");
        QTest::addColumn<QString>("path");
        QTest::addColumn<QString>("body");
        QTest::addColumn<QString>("expected");

        auto row = [](const char *name, Operation operation, const char *method, const char *path, const char *body,
                       const char *expected) {
            QTest::newRow(name) << operation << QString::fromLatin1(method) << QString::fromLatin1(path)
                                << QString::fromUtf8(body) << QString::fromUtf8(expected);
        };
        row(
            "user by name: the local name comes back",
            [](HttpHelper &h) { return h.queryUserByName(QStringLiteral("@alice")); }, "GET", "/v3/account/",
            R"({"username":"alice","domain":"kest.test"})", aliceReply);
        row(
            "user by name: unknown", [](HttpHelper &h) { return h.queryUserByName(QStringLiteral("@nobody")); }, "GET",
            "/v3/account/", R"({"username":"nobody","domain":"kest.test"})",
            R"({"code":1,"data":null,"msg":"user not found"})");
        row(
            "user by uid: the server's name is kept", [](HttpHelper &h) { return h.queryUserByUid(10002); }, "GET",
            "/v3/account/", R"({"uid":10002})",
            R"({"code":0,"data":{"user":{"gecos":"Bob","home":"/home/bob","name":"bob","password":"x",)"
            R"("permissions":[],"primary_group":{"id":10000,"name":"kest"},"shell":"/bin/bash","uid":10002}},"msg":"ok"})");
        row(
            "authenticate: right password",
            [](HttpHelper &h) {
                return h.authenticate(
                    QStringLiteral("@alice"), QStringLiteral("alice-password"), QStringLiteral("password"));
            },
            "POST", "/v1/auth/",
            R"({"data":{"username":"@alice","password":"alice-password","machine_id":"machine-1"},"method":"password"})",
            R"({"code":0,"data":{"result":true},"msg":"ok"})");
        row(
            "authenticate: wrong password, text escaped",
            [](HttpHelper &h) {
                return h.authenticate(QStringLiteral("@alice"), QStringLiteral("a\"b\\c"), QStringLiteral("otp"));
            },
            "POST", "/v1/auth/",
            "{\"data\":{\"username\":\"@alice\",\"password\":\"a\\\"b\\\\c\",\"machine_id\":\"machine-1\"},"
            "\"method\":\"otp\"}",
            R"({"code":0,"data":{"result":false},"msg":"ok"})");
        row(
            "group by name", [](HttpHelper &h) { return h.queryGroupByName(QStringLiteral("staff")); }, "GET",
            "/v3/group/", R"({"groupname":"staff"})",
            R"({"code":0,"data":{"group":{"gid":10010,"members":["alice"],"name":"staff"}},"msg":"ok"})");
        row(
            "group by gid", [](HttpHelper &h) { return h.queryGroupByGid(10000); }, "GET", "/v3/group/",
            R"({"gid":10000})",
            R"({"code":0,"data":{"group":{"gid":10000,"members":["alice","bob"],"name":"kest"}},"msg":"ok"})");
        row(
            "reset password",
            [](HttpHelper &h) {
                return h.resetPassword(
                    10001, QStringLiteral("@alice"), QStringLiteral("new-password"), QStringLiteral("alice-password"));
            },
            "PATCH", "/v3/client/reset_password",
            R"({"uid":10001,"username":"@alice","password":"new-password","old_password":"alice-password"})",
            R"({"code":0,"data":null,"msg":"ok"})");
        row(
            "reset password: wrong old password",
            [](HttpHelper &h) {
                return h.resetPassword(
                    10001, QStringLiteral("@alice"), QStringLiteral("new-password"), QStringLiteral("guess"));
            },
            "PATCH", "/v3/client/reset_password",
            R"({"uid":10001,"username":"@alice","password":"new-password","old_password":"guess"})",
            R"({"code":1,"data":null,"msg":"old password is wrong"})");
        row(
            "domain", [](HttpHelper &h) { return h.queryDomain(); }, "GET", "/v1/domain/", "",
            R"({"code":0,"data":{"domain":"kest.test"},"msg":"ok"})");
    }

    void operations()
    {
        QFETCH(Operation, operation);
        QFETCH(QString, method);
        QFETCH(QString, path);
        QFETCH(QString, body);
        QFETCH(QString, expected);

        QVERIFY(writeSettings({ { QStringLiteral("main/domain"), QStringLiteral("kest.test") } }));
        HttpHelper helper;
        QCOMPARE(operation(helper), expected);

        const QList<QJsonObject> requests = m_server->requests();
        QCOMPARE(requests.size(), 1);
        QCOMPARE(requests.first().value(QLatin1String("method")).toString(), method);
        QCOMPARE(requests.first().value(QLatin1String("path")).toString(), path);
        QCOMPARE(requests.first().value(QLatin1String("body")).toString(), body);
        QCOMPARE(requests.first().value(QLatin1String("client")).toString(), QStringLiteral("kest-test-client"));
        QCOMPARE(warningMismatch({}), QString());
    }

    void resetPasswordChangesTheServersPassword()
    {
        QVERIFY(writeSettings());
        HttpHelper helper;
        QCOMPARE(helper.resetPassword(
                     10001, QStringLiteral("@alice"), QStringLiteral("changed"), QStringLiteral("alice-password")),
            QStringLiteral(R"({"code":0,"data":null,"msg":"ok"})"));
        const QString rightNow = QStringLiteral(R"({"code":0,"data":{"result":true},"msg":"ok"})");
        const QString wrongNow = QStringLiteral(R"({"code":0,"data":{"result":false},"msg":"ok"})");
        QCOMPARE(helper.authenticate(QStringLiteral("@alice"), QStringLiteral("changed"), QStringLiteral("password")),
            rightNow);
        QCOMPARE(
            helper.authenticate(QStringLiteral("@alice"), QStringLiteral("alice-password"), QStringLiteral("password")),
            wrongNow);
        const QJsonArray users = m_server->data().value(QLatin1String("users")).toArray();
        QCOMPARE(users.at(0).toObject().value(QLatin1String("password")).toString(), QStringLiteral("changed"));
    }

    void pathsComeFromTheSettings()
    {
        QVERIFY(writeSettings({ { QStringLiteral("url/user"), QStringLiteral("/v9/people/") } }));
        HttpHelper helper;
        // An unknown path: 404 with a JSON body, which is handed back with the status warning.
        QCOMPARE(helper.queryUserByUid(10001), QStringLiteral(R"({"code":404,"data":null,"msg":"no such path"})"));
        QCOMPARE(m_server->requests().value(0).value(QLatin1String("path")).toString(), QStringLiteral("/v9/people/"));
        QCOMPARE(warningMismatch({ QStringLiteral("error code ContentNotFoundError url: *"),
                     QStringLiteral("http response status is not ok. actual http status code: 404") }),
            QString());
    }

    void statusNotOkKeepsTheBody()
    {
        QVERIFY(writeSettings());
        QVERIFY(m_server->setMisbehaviour(QStringLiteral("/v3/account/"), QStringLiteral("status:404")));
        HttpHelper helper;
        QCOMPARE(helper.queryUserByName(QStringLiteral("@alice")), QString::fromUtf8(aliceReply));
        QCOMPARE(warningMismatch({ QStringLiteral("error code ContentNotFoundError url: *"),
                     QStringLiteral("http response status is not ok. actual http status code: 404") }),
            QString());
    }

    void nameWithoutAtSendsNothing_data()
    {
        QTest::addColumn<QString>("name");
        QTest::addColumn<bool>("serverUp");
        QTest::newRow("plain name") << QStringLiteral("alice") << true;
        QTest::newRow("empty name") << QString() << true;
        QTest::newRow("@ not first") << QStringLiteral("alice@") << true;
        QTest::newRow("full-width at sign") << QStringLiteral("\uFF20alice") << true;
        QTest::newRow("plain name, server down") << QStringLiteral("alice") << false;
    }

    void nameWithoutAtSendsNothing()
    {
        QFETCH(QString, name);
        QFETCH(bool, serverUp);
        QVERIFY(writeSettings());
        if (!serverUp)
            m_server->stop();
        HttpHelper helper;
        QCOMPARE(helper.queryUserByName(name), unknownAccount);
        // Not even the reachability probe: no log line about the server either.
        QCOMPARE(warningMismatch({}), QString());
        QVERIFY(m_server->requests().isEmpty());
    }

    void serverDown_data()
    {
        QTest::addColumn<Operation>("operation");
        QTest::addColumn<bool>("settingsFile");
        for (const OperationCase &item : everyOperation()) {
            QTest::addRow("%s, nothing listening", item.name) << item.operation << true;
            QTest::addRow("%s, no settings file", item.name) << item.operation << false;
        }
    }

    void serverDown()
    {
        QFETCH(Operation, operation);
        QFETCH(bool, settingsFile);
        const quint16 port = m_server->port();
        m_server->stop();
        if (settingsFile)
            QVERIFY(writeSettings());
        HttpHelper helper;
        QCOMPARE(operation(helper), unreachable);
        const QString expected = settingsFile ? QStringLiteral("error host address: 127.0.0.2:%1, error detail: "
                                                               "Connection refused")
                                                    .arg(port)
                                              : QStringLiteral("configuration file is broken.");
        QCOMPARE(warningMismatch({ expected }), QString());
        QVERIFY2(m_server->restart(), qPrintable(m_server->errorText()));
        QVERIFY(m_server->requests().isEmpty());
    }

    void badReplies_data()
    {
        QTest::addColumn<Operation>("operation");
        QTest::addColumn<QString>("path");
        QTest::addColumn<QString>("behaviour");
        QTest::addColumn<QStringList>("expectedWarnings");
        for (const OperationCase &item : everyOperation()) {
            QTest::addRow("%s, no msg", item.name)
                << item.operation << QString::fromLatin1(item.path) << QStringLiteral("no-msg")
                << QStringList { QStringLiteral("http response data error. url: {URL}") };
            QTest::addRow("%s, not JSON", item.name)
                << item.operation << QString::fromLatin1(item.path) << QStringLiteral("not-json")
                << QStringList { QStringLiteral("invalid reply data, parse error: *"),
                       QStringLiteral("http response data error. url: {URL}") };
        }
        const OperationCase byUid = everyOperation().at(1);
        QTest::newRow("connection closed")
            << byUid.operation << QString::fromLatin1(byUid.path) << QStringLiteral("close")
            << QStringList { QStringLiteral("error code RemoteHostClosedError url: {URL}, error detail: *"),
                   QStringLiteral("invalid reply data, parse error: *"),
                   QStringLiteral("http response status is not ok. actual http status code: 0"),
                   QStringLiteral("http response data error. url: {URL}") };
        QTest::newRow("no answer within the time-out")
            << byUid.operation << QString::fromLatin1(byUid.path) << QStringLiteral("delay:20000")
            << QStringList { QStringLiteral("error code OperationCanceledError url: {URL}, error detail: *"),
                   QStringLiteral("invalid reply data, parse error: *"),
                   QStringLiteral("http response status is not ok. actual http status code: 0"),
                   QStringLiteral("http response data error. url: {URL}") };
    }

    void badReplies()
    {
        QFETCH(Operation, operation);
        QFETCH(QString, path);
        QFETCH(QString, behaviour);
        QFETCH(QStringList, expectedWarnings);
        QVERIFY(writeSettings({ { QStringLiteral("main/network-timeout"), 1 } }));
        QVERIFY(m_server->setMisbehaviour(path, behaviour));
        HttpHelper helper;
        QCOMPARE(operation(helper), refused);
        // Qt's HTTP layer tries again when a connection is closed before any answer.
        if (behaviour == QLatin1String("close"))
            QVERIFY(!m_server->requests().isEmpty());
        else
            QCOMPARE(m_server->requests().size(), 1);
        const QString url = QStringLiteral("https://127.0.0.2:") + QString::number(m_server->port()) + path;
        QCOMPARE(warningMismatch(expectedWarnings.replaceInStrings(QStringLiteral("{URL}"), url)), QString());
    }

    void missingCaStillSends()
    {
        const QString missing = m_server->directory() + QStringLiteral("/missing-ca.pem");
        QVERIFY(writeSettings({ { QStringLiteral("url/server-cert"), missing } }));
        HttpHelper helper;
        QCOMPARE(helper.queryUserByName(QStringLiteral("@alice")), QString::fromUtf8(aliceReply));
        QCOMPARE(m_server->requests().size(), 1);
        // The system CAs do not know the test server: reported, not fatal, for a literal address.
        QCOMPARE(warningMismatch({ QStringLiteral("server cert file is not exists. config: ") + missing,
                     QStringLiteral("cannot set server key."), QStringLiteral("ssl error url: *") }),
            QString());
    }

    void clientWithoutCertificateIsRefused()
    {
        QVERIFY(writeSettings(
            { { QStringLiteral("url/public-key"), QVariant() }, { QStringLiteral("url/private-key"), QVariant() } }));
        HttpHelper helper;
        QCOMPARE(helper.queryDomain(), refused);
        QVERIFY(m_server->requests().isEmpty());
    }

    void plainHttpScheme()
    {
        m_server->setPlainHttp(true);
        QVERIFY2(m_server->restart(), qPrintable(m_server->errorText()));
        m_server->setPlainHttp(false);
        QVERIFY(writeSettings({ { QStringLiteral("url/protocol"), QStringLiteral("http://") },
            { QStringLiteral("url/server-cert"), QVariant() }, { QStringLiteral("url/public-key"), QVariant() },
            { QStringLiteral("url/private-key"), QVariant() } }));
        HttpHelper helper;
        QCOMPARE(helper.queryUserByName(QStringLiteral("@alice")), QString::fromUtf8(aliceReply));
        // No TLS set-up was attempted: none of the certificate files was even looked at.
        QCOMPARE(warningMismatch({}), QString());
        QCOMPARE(m_server->requests().value(0).value(QLatin1String("client")).toString(), QString());
        QVERIFY2(m_server->restart(), qPrintable(m_server->errorText()));
    }

private:
    bool writeSettings(const QVariantMap &overrides = QVariantMap())
    {
        return m_root->writeSettings(m_server->settingsIni(overrides));
    }

    std::unique_ptr<DomainServerFixture> m_server;
    std::unique_ptr<TestRoot> m_root;
};

QTEST_GUILESS_MAIN(HttpOperationsTest)
#include "test_httpoperations.moc"
