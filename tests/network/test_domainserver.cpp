#include "domainserverfixture.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QProcess>
#include <QSslCertificate>
#include <QSslConfiguration>
#include <QSslKey>
#include <QSslSocket>
#include <QTemporaryDir>
#include <QTest>

#include <memory>

namespace
{
const int waitMs = 10000;

struct Answer {
    bool answered = false;
    int status = 0;
    QByteArray body;
};

QSslKey keyFrom(const QString &path)
{
    QFile file(path);
    if (!file.open(QIODevice::ReadOnly))
        return QSslKey();
    return QSslKey(&file, QSsl::Rsa);
}

QByteArray request(const QByteArray &method, const QByteArray &path, const QByteArray &body)
{
    return method + ' ' + path + " HTTP/1.1\r\nHost: 127.0.0.2\r\nContent-Length: " + QByteArray::number(body.size())
        + "\r\n\r\n" + body;
}
} // namespace

class DomainServerTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        m_server = std::make_unique<DomainServerFixture>();
        QVERIFY2(m_server->isValid(), qPrintable(m_server->errorText()));
        QVERIFY2(m_server->start(), qPrintable(m_server->errorText()));
    }

    void init()
    {
        QVERIFY(m_server->setData(DomainServerFixture::defaultData()));
        QVERIFY(m_server->clearMisbehaviour());
        QVERIFY(m_server->clearRequests());
    }

    void answers_data()
    {
        QTest::addColumn<QByteArray>("raw");
        QTest::addColumn<int>("status");
        QTest::addColumn<QByteArray>("body");

        QTest::newRow("user by name, one @ stripped")
            << request("GET", "/v3/account/", R"({"username":"@bob"})") << 200
            << QByteArray(R"({"code":0,"data":{"user":{"gecos":"Bob","home":"/home/bob","name":"bob","password":"x",)"
                          R"("permissions":[],"primary_group":{"id":10000,"name":"kest"},"shell":"/bin/bash",)"
                          R"("uid":10002}},"msg":"ok"})");
        QTest::newRow("only one @ is stripped") << request("GET", "/v3/account/", R"({"username":"@@bob"})") << 200
                                                << QByteArray(R"({"code":1,"data":null,"msg":"user not found"})");

        QTest::newRow("user, neither name nor uid") << request("GET", "/v3/account/",
            "{}") << 400 << QByteArray(R"({"code":2,"data":null,"msg":"username or uid required"})");
        QTest::newRow("body not JSON") << request("GET", "/v3/account/",
            "username=bob") << 400 << QByteArray(R"({"code":2,"data":null,"msg":"request body is not a JSON object"})");
        QTest::newRow("auth, unknown user")
            << request("POST", "/v1/auth/", R"({"data":{"username":"@eve","password":"x"},"method":"password"})") << 200
            << QByteArray(R"({"code":0,"data":{"result":false},"msg":"ok"})");
        QTest::newRow("auth, right password, no @")
            << request("POST", "/v1/auth/", R"({"data":{"username":"bob","password":"bob-password"}})") << 200
            << QByteArray(R"({"code":0,"data":{"result":true},"msg":"ok"})");
        QTest::newRow("reset, uid of another user")
            << request("PATCH", "/v3/client/reset_password",
                   R"({"uid":10001,"username":"@bob","password":"n","old_password":"bob-password"})")
            << 200 << QByteArray(R"({"code":1,"data":null,"msg":"user not found"})");

        QTest::newRow("query string ignored") << request("GET", "/v1/domain/?x=1", QByteArray()) << 200
                                              << QByteArray(R"({"code":0,"data":{"domain":"kest.test"},"msg":"ok"})");
        QTest::newRow("wrong method") << request("POST", "/v3/account/", "{}") << 405
                                      << QByteArray(R"({"code":405,"data":null,"msg":"method not allowed"})");
        QTest::newRow("unknown path") << request("GET", "/v2/other", QByteArray()) << 404
                                      << QByteArray(R"({"code":404,"data":null,"msg":"no such path"})");
        QTest::newRow("malformed request line") << QByteArray("HELLO\r\n\r\n") << 400
                                                << QByteArray(R"({"code":400,"msg":"malformed request","data":null})");
        QTest::newRow("chunked body") << QByteArray(
            "GET /v1/domain/ HTTP/1.1\r\nTransfer-Encoding: chunked\r\n\r\n0\r\n\r\n")
                                      << 400 << QByteArray(R"({"code":400,"msg":"malformed request","data":null})");
        QTest::newRow("body above the cap")
            << QByteArray("GET /v3/account/ HTTP/1.1\r\nContent-Length: 1048577\r\n\r\n") << 413
            << QByteArray(R"({"code":413,"msg":"request too large","data":null})");
        QTest::newRow("head above the cap")
            << QByteArray("GET /v1/domain/ HTTP/1.1\r\nX-Filler: " + QByteArray(20000, 'a') + "\r\n\r\n") << 413
            << QByteArray(R"({"code":413,"msg":"request too large","data":null})");
    }

    void answers()
    {
        QFETCH(QByteArray, raw);
        QFETCH(int, status);
        QFETCH(QByteArray, body);
        const Answer answer = exchange(raw);
        QVERIFY(answer.answered);
        QCOMPARE(answer.status, status);
        QCOMPARE(answer.body, body);
    }

    void largeBodyArrivesWhole()
    {
        // Far more than one TLS record: the body is gathered up to its Content-Length.
        const QByteArray body = "{\"data\":{\"username\":\"bob\",\"password\":\"" + QByteArray(300000, 'p') + "\"}}";
        const Answer answer = exchange(request("POST", "/v1/auth/", body));
        QCOMPARE(answer.body, QByteArray(R"({"code":0,"data":{"result":false},"msg":"ok"})"));
        const QJsonObject logged = m_server->requests().value(0);
        QCOMPARE(logged.value(QLatin1String("body")).toString().toUtf8(), body);
    }

    void behaviourForOnePathOrAll_data()
    {
        QTest::addColumn<QString>("path");
        QTest::addColumn<int>("status");
        QTest::addColumn<QByteArray>("body");
        QTest::newRow("path of its own") << QStringLiteral("/v1/domain/") << 201
                                         << QByteArray(R"({"code":0,"data":{"domain":"kest.test"},"msg":"ok"})");
        QTest::newRow("every other path") << QStringLiteral("/v3/group/") << 200 << QByteArray("this is not json");
        QTest::newRow("unknown behaviour is ignored")
            << QStringLiteral("/v3/account/") << 200 << QByteArray(R"({"code":1,"data":null,"msg":"user not found"})");
    }

    void behaviourForOnePathOrAll()
    {
        QFETCH(QString, path);
        QFETCH(int, status);
        QFETCH(QByteArray, body);
        QVERIFY(m_server->setMisbehaviour(QStringLiteral("*"), QStringLiteral("not-json")));
        QVERIFY(m_server->setMisbehaviour(QStringLiteral("/v1/domain/"), QStringLiteral("status:201")));
        QVERIFY(m_server->setMisbehaviour(QStringLiteral("/v3/account/"), QStringLiteral("sulk")));
        const Answer answer = exchange(request("GET", path.toLatin1(), R"({"uid":1})"));
        QCOMPARE(answer.status, status);
        QCOMPARE(answer.body, body);
    }

    void refusedRequestChangesNothing()
    {
        QVERIFY(m_server->setMisbehaviour(QStringLiteral("/v3/client/reset_password"), QStringLiteral("close")));
        const Answer answer = exchange(request("PATCH", "/v3/client/reset_password",
            R"({"username":"bob","password":"n","old_password":"bob-password"})"));
        QVERIFY(!answer.answered);
        QCOMPARE(m_server->data(), DomainServerFixture::defaultData());
        QCOMPARE(m_server->requests().size(), 1);
    }

    void dataFileEditsApplyAtOnce()
    {
        QJsonObject data = DomainServerFixture::defaultData();
        QJsonArray users = data.value(QLatin1String("users")).toArray();
        users.append(
            QJsonObject { { QStringLiteral("uid"), 10003 }, { QStringLiteral("name"), QStringLiteral("carol") },
                { QStringLiteral("password"), QStringLiteral("secret") } });
        data.insert(QStringLiteral("users"), users);
        QVERIFY(m_server->setData(data));
        const Answer answer = exchange(request("GET", "/v3/account/", R"({"username":"carol"})"));
        QCOMPARE(answer.body,
            QByteArray(R"({"code":0,"data":{"user":{"name":"carol","password":"x","uid":10003}},"msg":"ok"})"));
    }

    void bareConnectionsAreNotRequests()
    {
        QTcpSocket probe;
        probe.connectToHost(DomainServerFixture::address(), m_server->port());
        QVERIFY(probe.waitForConnected(waitMs));
        probe.abort();
        QCOMPARE(exchange(request("GET", "/v1/domain/", QByteArray())).status, 200);
        QCOMPARE(m_server->requests().size(), 1);
    }

    void clientCertificate_data()
    {
        QTest::addColumn<QString>("client");
        QTest::newRow("none") << QString();
        QTest::newRow("signed by another CA") << QStringLiteral("foreign");
    }

    void clientCertificate()
    {
        QFETCH(QString, client);
        QTemporaryDir other;
        QSslConfiguration configuration = clientConfiguration();
        if (client.isEmpty()) {
            configuration.setLocalCertificateChain({});
            configuration.setPrivateKey(QSslKey());
        } else {
            QVERIFY(DomainServerFixture::makeCertificates(other.path()));
            configuration.setLocalCertificateChain(
                QSslCertificate::fromPath(other.filePath(QStringLiteral("client.pem"))));
            configuration.setPrivateKey(keyFrom(other.filePath(QStringLiteral("client.key"))));
        }
        QVERIFY(!exchange(request("GET", "/v1/domain/", QByteArray()), configuration).answered);
        QVERIFY(m_server->requests().isEmpty());
    }

    void restartKeepsThePort()
    {
        const quint16 port = m_server->port();
        QVERIFY2(m_server->restart(), qPrintable(m_server->errorText()));
        QCOMPARE(m_server->port(), port);
        QCOMPARE(exchange(request("GET", "/v1/domain/", QByteArray())).status, 200);
    }

    void commandLineErrors_data()
    {
        QTest::addColumn<QStringList>("arguments");
        QTest::addColumn<QByteArray>("message");
        const QStringList tls { QStringLiteral("--cert"), m_server->directory() + QStringLiteral("/server.pem"),
            QStringLiteral("--key"), m_server->directory() + QStringLiteral("/server.key"), QStringLiteral("--ca"),
            m_server->caFile() };
        const QStringList data { QStringLiteral("--data"), m_server->dataFile() };
        QTest::newRow("no data file") << tls << QByteArray("--data is required");

        QTest::newRow("address is a name")
            << (tls + data + QStringList { QStringLiteral("--address"), QStringLiteral("localhost") })
            << QByteArray("not a loopback address: localhost");

        QTest::newRow("no certificate") << data << QByteArray("cannot read the certificate");
    }

    void commandLineErrors()
    {
        QFETCH(QStringList, arguments);
        QFETCH(QByteArray, message);
        QProcess server;
        server.start(qEnvironmentVariable("KEST_TEST_BINARY_DIR")
                + QStringLiteral("/tools/test-domain-server/kest-test-domain-server"),
            arguments);
        QVERIFY(server.waitForFinished(waitMs));
        QCOMPARE(server.exitStatus(), QProcess::NormalExit);
        QCOMPARE(server.exitCode(), 1);
        const QByteArray error = server.readAllStandardError();
        QVERIFY2(error.startsWith("kest-test-domain-server: " + message), error.constData());
        QVERIFY(server.readAllStandardOutput().isEmpty());
    }

private:
    QSslConfiguration clientConfiguration() const
    {
        QSslConfiguration configuration = QSslConfiguration::defaultConfiguration();
        configuration.setCaCertificates(QSslCertificate::fromPath(m_server->caFile()));
        configuration.setLocalCertificateChain(QSslCertificate::fromPath(m_server->clientCertificateFile()));
        configuration.setPrivateKey(keyFrom(m_server->clientKeyFile()));
        return configuration;
    }

    Answer exchange(const QByteArray &raw) const { return exchange(raw, clientConfiguration()); }

    // One request over TLS with blocking calls; the server closes after its answer.
    Answer exchange(const QByteArray &raw, const QSslConfiguration &configuration) const
    {
        QSslSocket socket;
        socket.setSslConfiguration(configuration);
        socket.connectToHostEncrypted(DomainServerFixture::address(), m_server->port());
        if (!socket.waitForEncrypted(waitMs))
            return Answer();
        socket.write(raw);
        QByteArray received;
        while (socket.waitForReadyRead(waitMs))
            received += socket.readAll();
        received += socket.readAll();

        Answer answer;
        const int headEnd = received.indexOf("\r\n\r\n");
        const QList<QByteArray> statusLine = received.left(received.indexOf("\r\n")).split(' ');
        if (headEnd < 0 || statusLine.size() < 2)
            return answer;
        answer.answered = true;
        answer.status = statusLine.at(1).toInt();
        answer.body = received.mid(headEnd + 4);
        return answer;
    }

    std::unique_ptr<DomainServerFixture> m_server;
};

QTEST_GUILESS_MAIN(DomainServerTest)
#include "test_domainserver.moc"
