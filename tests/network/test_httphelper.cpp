#include "domainserverfixture.h"
#include "httphelper.h"
#include "messagehandler.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QDateTime>
#include <QFile>
#include <QJsonDocument>
#include <QRegularExpression>
#include <QTcpServer>
#include <QTest>

#include <functional>

namespace
{
const QString refused = QStringLiteral(R"({"code": -1,"msg": "web server refuse login."})");
const QString unreachable = QStringLiteral(R"({"code": -2,"msg": "client cannot connect to server."})");
const QString unknownAccount = QStringLiteral(R"({"code": -3,"msg": "network account does not exist."})");
const QString domainReply = QStringLiteral(R"({"code":0,"data":{"domain":"kest.test"},"msg":"ok"})");
const QString alice = QStringLiteral(R"({"code":0,"data":{"user":{"gecos":"Alice","home":"/home/alice","name":"%1",)"
                                     R"("password":"x","permissions":["sudo","lp"],"primary_group":{"id":10000,)"
                                     R"("name":"kest"},"shell":"/bin/bash","uid":10001}},"msg":"ok"})");

struct Operation {
    const char *name;
    std::function<QString(HttpHelper &)> call;
    const char *method;
    const char *path;
    const char *body;
    QString reply;
};

const QList<Operation> &everyOperation()
{
    static const QList<Operation> list {
        { "queryUserByName", [](HttpHelper &h) { return h.queryUserByName(QStringLiteral("@alice")); }, "GET",
            "/v3/account/", R"({"username":"alice","domain":"kest.test"})", alice.arg(QLatin1String("@alice")) },
        { "queryUserByUid", [](HttpHelper &h) { return h.queryUserByUid(10001); }, "GET", "/v3/account/",
            R"({"uid":10001})", alice.arg(QLatin1String("alice")) },
        { "authenticate",
            [](HttpHelper &h) {
                return h.authenticate(QStringLiteral("@alice"), QStringLiteral("a\"b\\c"), QStringLiteral("otp"));
            },
            "POST", "/v1/auth/",
            "{\"data\":{\"username\":\"@alice\",\"password\":\"a\\\"b\\\\c\",\"machine_id\":\"machine-1\"},"
            "\"method\":\"otp\"}",
            QStringLiteral(R"({"code":0,"data":{"result":false},"msg":"ok"})") },
        { "queryGroupByName", [](HttpHelper &h) { return h.queryGroupByName(QStringLiteral("staff")); }, "GET",
            "/v3/group/", R"({"groupname":"staff"})",
            QStringLiteral(
                R"({"code":0,"data":{"group":{"gid":10010,"members":["alice"],"name":"staff"}},"msg":"ok"})") },
        { "queryGroupByGid", [](HttpHelper &h) { return h.queryGroupByGid(10000); }, "GET", "/v3/group/",
            R"({"gid":10000})",
            QStringLiteral(
                R"({"code":0,"data":{"group":{"gid":10000,"members":["alice","bob"],"name":"kest"}},"msg":"ok"})") },
        { "resetPassword",
            [](HttpHelper &h) {
                return h.resetPassword(
                    10001, QStringLiteral("@alice"), QStringLiteral("new"), QStringLiteral("alice-password"));
            },
            "PATCH", "/v3/client/reset_password",
            R"({"uid":10001,"username":"@alice","password":"new","old_password":"alice-password"})",
            QStringLiteral(R"({"code":0,"data":null,"msg":"ok"})") },
        { "queryDomain", [](HttpHelper &h) { return h.queryDomain(); }, "GET", "/v1/domain/", "", domainReply },
    };
    return list;
}

// A port of the server's address on which nothing listens.
quint16 closedPort()
{
    QTcpServer probe;
    return probe.listen(QHostAddress(DomainServerFixture::address())) ? probe.serverPort() : 0;
}

// The warnings logged so far; a line matching the expected one at its place ("*": any text) is given
// as that one, so that a comparison shows the real differences only.
QStringList logged(const QStringList &expected)
{
    QStringList actual;
    for (const SyslogLine &line : SyslogCapture::lines()) {
        if (line.priority != 4)
            continue;
        const QString wanted = expected.value(actual.size());
        const QString text
            = QString::fromUtf8(line.text).remove(QRegularExpression(QStringLiteral("^cpu time: \\d+, ")));
        const QRegularExpression pattern(QRegularExpression::anchoredPattern(QRegularExpression::escape(wanted).replace(
                                             QLatin1String("\\*"), QLatin1String(".*"))),
            QRegularExpression::DotMatchesEverythingOption);
        actual << (pattern.match(text).hasMatch() ? wanted : text);
    }
    return actual;
}
} // namespace

class HttpHelperTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        qInstallMessageHandler(messageHandler);
        QVERIFY2(m_server.isValid() && m_server.start(), qPrintable(m_server.errorText()));
        QVERIFY(m_root.writeFile(QStringLiteral("/usr/share/kest/machine.txt"), "machine-1\nsecond\n"));
        QVERIFY(DomainServerFixture::makeCertificates(m_other.path()));
    }

    void init()
    {
        QVERIFY(showCertificate(QStringLiteral("server")));
        QVERIFY(m_server.setData(DomainServerFixture::defaultData()));
        QVERIFY(m_server.clearMisbehaviour() && m_server.clearRequests());
        SyslogCapture::clear();
    }

    void exchange_data()
    {
        QTest::addColumn<int>("op");
        QTest::addColumn<QVariantMap>("settings");
        QTest::addColumn<QString>("behaviour");
        QTest::addColumn<QString>("expected");
        QTest::addColumn<int>("sent");
        QTest::addColumn<QStringList>("warnings");
        QJsonParseError notJson;
        QJsonDocument::fromJson("this is not json", &notJson);
        const quint16 closed = closedPort();
        const QString notOk = QStringLiteral("http response status is not ok. actual http status code: ");
        for (int i = 0; i < everyOperation().size(); ++i) {
            const Operation &op = everyOperation().at(i);
            const QString dataError = QStringLiteral("http response data error. url: ") + url(op.path);
            QTest::newRow(op.name) << i << QVariantMap() << QString() << op.reply << 1 << QStringList();
            QTest::addRow("%s, server down", op.name)
                << i << QVariantMap { { QStringLiteral("main/port"), closed } } << QString() << unreachable << 0
                << QStringList {
                       QStringLiteral("error host address: 127.0.0.2:%1, error detail: Connection refused").arg(closed)
                   };
            QTest::addRow("%s, no msg", op.name)
                << i << QVariantMap() << QStringLiteral("no-msg") << refused << 1 << QStringList { dataError };
            QTest::addRow("%s, not JSON", op.name)
                << i << QVariantMap() << QStringLiteral("not-json") << refused << 1
                << QStringList { QStringLiteral("invalid reply data, parse error: ") + notJson.errorString()
                           + QStringLiteral(", raw data: this is not json, http status: 200, url: ") + url(op.path)
                           + QStringLiteral(", method: ") + QLatin1String(op.method),
                       dataError };
        }
        const QString user = url("/v3/account/");
        const QString domain = url("/v1/domain/");
        const QStringList abandoned { QStringLiteral("error code * url: * error detail: *"),
            QStringLiteral("invalid reply data, parse error: *, raw data: , http status: 0, url: *, method: GET"),
            notOk + QStringLiteral("0"), QStringLiteral("http response data error. url: *") };
        QTest::newRow("404 with a JSON body")
            << 0 << QVariantMap() << QStringLiteral("status:404") << alice.arg(QLatin1String("@alice")) << 1
            << QStringList { QStringLiteral("error code ContentNotFoundError url: ") + user
                       + QStringLiteral(", error detail: *"),
                   notOk + QStringLiteral("404") };
        QTest::newRow("closed without an answer: sent once")
            << 0 << QVariantMap() << QStringLiteral("close") << refused << 1
            << QStringList {
                   QStringLiteral("error code RemoteHostClosedError url: ") + user + QStringLiteral(", error detail: *")
               } + abandoned.mid(1);
        QTest::newRow("redirect not followed") << 0 << QVariantMap() << QStringLiteral("redirect:/v1/domain/")
                                               << QStringLiteral(R"({"code":302,"data":null,"msg":"moved"})") << 1
                                               << QStringList { notOk + QStringLiteral("302") };
        QTest::newRow("reply after the time-out")
            << 0 << QVariantMap { { QStringLiteral("main/network-timeout"), 1 } } << QStringLiteral("delay:2000")
            << refused << 1
            << QStringList { QStringLiteral("error code OperationCanceledError url: ") + user
                   + QStringLiteral(", error detail: Operation canceled") }
                + abandoned.mid(1);
        const QString missing = m_other.filePath(QStringLiteral("missing.pem"));
        const QStringList untrusted { QStringLiteral("ssl error url: ") + domain
            + QStringLiteral(" certificate error: *.     certificate error: *") };
        QTest::newRow("CA file missing, literal address: nothing sent")
            << 6 << QVariantMap { { QStringLiteral("url/server-cert"), missing } } << QString() << unreachable << 0
            << QStringList { QStringLiteral("server cert file is not exists. config: ") + missing,
                   QStringLiteral("cannot set server key.") };
        QTest::newRow("server of another CA")
            << 6 << QVariantMap { { QStringLiteral("url/server-cert"), m_other.filePath(QStringLiteral("ca.pem")) } }
            << QString() << unreachable << 0 << untrusted;
        QTest::newRow("self-signed server")
            << 6 << QVariantMap() << QStringLiteral("cert:selfsigned") << unreachable << 0 << untrusted;
        QTest::newRow("expired server certificate")
            << 6 << QVariantMap() << QStringLiteral("cert:expired") << unreachable << 0 << untrusted;
        QTest::newRow("no subjectAltName, literal address: taken")
            << 6 << QVariantMap() << QStringLiteral("cert:nosan") << domainReply << 1 << QStringList();
        QTest::newRow("no client certificate")
            << 6 << QVariantMap { { QStringLiteral("url/public-key"), QVariant() } } << QString() << refused << 0
            << QStringList { QStringLiteral("client public key file is not exists. config: "),
                   QStringLiteral("cannot set local public key.") }
                + abandoned;
        QTest::newRow("no client key")
            << 6 << QVariantMap { { QStringLiteral("url/private-key"), missing } } << QString() << refused << 0
            << QStringList { QStringLiteral("client private key file is not exists. config: ") + missing,
                   QStringLiteral("cannot read local private key.") }
                + abandoned;
        QTest::newRow("client certificate of another CA")
            << 6
            << QVariantMap { { QStringLiteral("url/public-key"), m_other.filePath(QStringLiteral("client.pem")) },
                   { QStringLiteral("url/private-key"), m_other.filePath(QStringLiteral("client.key")) } }
            << QString() << refused << 0 << abandoned;
    }

    void exchange()
    {
        QFETCH(int, op);
        QFETCH(QVariantMap, settings);
        QFETCH(QString, behaviour);
        QFETCH(QString, expected);
        QFETCH(int, sent);
        QFETCH(QStringList, warnings);
        const Operation &operation = everyOperation().at(op);
        QVERIFY(writeSettings(settings));
        if (behaviour.startsWith(QLatin1String("cert:"))) {
            QVERIFY(showCertificate(behaviour.mid(5)));
            behaviour.clear();
        }
        QVERIFY(m_server.setMisbehaviour(QLatin1String(operation.path), behaviour));
        HttpHelper helper;
        QCOMPARE(operation.call(helper), expected);
        const QList<QJsonObject> requests = m_server.requests();
        QCOMPARE(requests.size(), sent);
        QCOMPARE(logged(warnings), warnings);
        if (!sent)
            return;
        QJsonObject request = requests.first();
        const QJsonObject headers = request.take(QLatin1String("headers")).toObject();
        request.remove(QLatin1String("connection"));
        QCOMPARE(request,
            QJsonObject({ { QStringLiteral("method"), QLatin1String(operation.method) },
                { QStringLiteral("path"), QLatin1String(operation.path) },
                { QStringLiteral("body"), QLatin1String(operation.body) },
                { QStringLiteral("client"), QStringLiteral("kest-test-client") } }));
        QCOMPARE(headers.value(QLatin1String("content-type")).toString(), QStringLiteral("application/json"));
        QCOMPARE(headers.value(QLatin1String("user-agent")).toString(), QStringLiteral("KEST"));
        QCOMPARE(headers.value(QLatin1String("accept")).toString(), QStringLiteral("application/json"));
    }

    // A server given by IPv6 address, or by a host name that its certificate must then name.
    void addressForms_data()
    {
        QTest::addColumn<QString>("listen");
        QTest::addColumn<QString>("ip");
        QTest::addColumn<QString>("certificate");
        QTest::addColumn<QString>("expected");
        QTest::newRow("IPv6 literal") << QStringLiteral("::1") << QStringLiteral("::1") << QStringLiteral("server")
                                      << domainReply;
        QTest::newRow("host name") << QStringLiteral("127.0.0.1") << QStringLiteral("localhost")
                                   << QStringLiteral("server") << domainReply;
        QTest::newRow("host name the certificate lacks")
            << QStringLiteral("127.0.0.1") << QStringLiteral("localhost") << QStringLiteral("nosan") << unreachable;
    }

    void addressForms()
    {
        QFETCH(QString, listen);
        QFETCH(QString, ip);
        QFETCH(QString, certificate);
        m_server.setListenAddress(listen);
        QVERIFY(m_server.start(0, false, certificate));
        m_certificate.clear(); // the next init() starts the usual server again
        QVERIFY(writeSettings({ { QStringLiteral("main/ip"), ip } }));
        HttpHelper helper;
        QTEST(helper.queryDomain(), "expected");
        m_server.setListenAddress(DomainServerFixture::address());
    }

    // Requests share one connection until the TLS files change.
    void keptConnection()
    {
        QVERIFY(writeSettings());
        HttpHelper helper;
        for (int i = 0; i < 3; ++i)
            QCOMPARE(helper.queryDomain(), domainReply);
        QFile key(m_server.filePath(QStringLiteral("client.key")));
        QVERIFY(key.open(QIODevice::Append));
        QVERIFY(key.setFileTime(QDateTime::currentDateTime().addSecs(1), QFileDevice::FileModificationTime));
        key.close();
        QCOMPARE(helper.queryDomain(), domainReply);
        QList<int> connections;
        for (const QJsonObject &request : m_server.requests())
            connections << request.value(QLatin1String("connection")).toInt();
        QCOMPARE(connections.size(), 4);
        QCOMPARE(connections.mid(0, 3), (QList<int> { connections.first(), connections.first(), connections.first() }));
        QVERIFY(connections.last() != connections.first());
    }

    // One failed connection starts an outage: later calls answer at once, without a word or a packet,
    // until a probe reaches the server again.
    void outage()
    {
        const quint16 closed = closedPort();
        QVERIFY(writeSettings({ { QStringLiteral("main/port"), closed } }));
        HttpHelper helper;
        for (int i = 0; i < 3; ++i)
            QCOMPARE(helper.queryDomain(), unreachable);
        QCOMPARE(logged({}),
            QStringList {
                QStringLiteral("error host address: 127.0.0.2:%1, error detail: Connection refused").arg(closed) });
        QVERIFY(writeSettings());
        QCOMPARE(helper.queryDomain(), unreachable);
        QVERIFY(m_server.requests().isEmpty());
        QString hostPort;
        QVERIFY(helper.checkServerAddress(hostPort));
        QCOMPARE(helper.queryDomain(), domainReply);
    }

    void withoutSettingsFileNothingIsSent()
    {
        QVERIFY(writeSettings() && m_root.removeSettings());
        HttpHelper helper;
        QCOMPARE(helper.queryDomain(), unreachable);
        QCOMPARE(logged({}), QStringList { QStringLiteral("configuration file is broken.") });
        QVERIFY(m_server.requests().isEmpty());
    }

    void nameWithoutAtSendsNothing_data()
    {
        QTest::addColumn<QString>("name");
        QTest::addColumn<bool>("serverUp");
        QTest::newRow("plain name") << QStringLiteral("alice") << true;
        QTest::newRow("full-width at sign") << QStringLiteral("\uFF20alice") << true;
        QTest::newRow("server down: not even probed") << QStringLiteral("alice") << false;
    }

    void nameWithoutAtSendsNothing()
    {
        QFETCH(QString, name);
        QFETCH(bool, serverUp);
        QVERIFY(writeSettings({ { QStringLiteral("main/port"), serverUp ? m_server.port() : closedPort() } }));
        HttpHelper helper;
        QCOMPARE(helper.queryUserByName(name), unknownAccount);
        QCOMPARE(logged({}), QStringList());
        QVERIFY(m_server.requests().isEmpty());
    }

    void plainScheme()
    {
        QVERIFY2(m_server.start(m_server.port(), true), qPrintable(m_server.errorText()));
        // Without any certificate setting, a look at one would log its absence.
        QVERIFY(writeSettings({ { QStringLiteral("url/protocol"), QStringLiteral("http://") },
            { QStringLiteral("url/server-cert"), QVariant() }, { QStringLiteral("url/public-key"), QVariant() },
            { QStringLiteral("url/private-key"), QVariant() } }));
        HttpHelper helper;
        const QString reply = helper.queryUserByName(QStringLiteral("@alice"));
        QVERIFY2(m_server.start(m_server.port()), qPrintable(m_server.errorText()));
        QCOMPARE(reply, alice.arg(QLatin1String("@alice")));
        QCOMPARE(m_server.requests().value(0).value(QLatin1String("client")).toString(), QString());
        QCOMPARE(logged({}), QStringList());
    }

private:
    bool showCertificate(const QString &name)
    {
        if (name == m_certificate)
            return true;
        m_certificate = name;
        return m_server.start(m_server.port(), false, name);
    }

    bool writeSettings(QVariantMap overrides = QVariantMap())
    {
        overrides.insert(QStringLiteral("main/domain"), QStringLiteral("kest.test"));
        return m_root.writeSettings(m_server.settingsIni(overrides));
    }

    QString url(const char *path) const
    {
        return QStringLiteral("https://127.0.0.2:") + QString::number(m_server.port()) + QLatin1String(path);
    }

    TestRoot m_root;
    DomainServerFixture m_server;
    QTemporaryDir m_other;
    QString m_certificate = QStringLiteral("server");
};

QTEST_GUILESS_MAIN(HttpHelperTest)
#include "test_httphelper.moc"
