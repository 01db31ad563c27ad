#include "domainserverfixture.h"
#include "httphelper.h"
#include "kestpaths.h"
#include "messagehandler.h"
#include "test_httpsupport.h"
#include "testroot.h"

#include <QElapsedTimer>
#include <QJsonDocument>
#include <QNetworkAccessManager>
#include <QNetworkRequest>
#include <QPointer>
#include <QSignalSpy>
#include <QSslCertificate>
#include <QSslConfiguration>
#include <QSslKey>
#include <QTest>

#include <memory>
#include <thread>

using HttpTestSupport::closedPort;
using HttpTestSupport::warningMismatch;

namespace
{
const QByteArray domainReply = R"({"code":0,"data":{"domain":"kest.test"},"msg":"ok"})";
} // namespace

class HttpHelperTest : public QObject
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
        QVERIFY(m_server->clearMisbehaviour());
        QVERIFY(m_server->clearRequests());
        SyslogCapture::clear();
    }

    void cleanup() { m_root.reset(); }

    void checkServerAddress_data()
    {
        QTest::addColumn<QString>("situation");
        QTest::addColumn<bool>("reachable");
        QTest::addColumn<QStringList>("expectedWarnings");
        QTest::newRow("listening") << QStringLiteral("listening") << true << QStringList();
        QTest::newRow("nothing listening")
            << QStringLiteral("closed") << false
            << QStringList { QStringLiteral("error host address: 127.0.0.2:{PORT}, error detail: Connection refused") };
        QTest::newRow("no settings file") << QStringLiteral("no settings") << false
                                          << QStringList { QStringLiteral("configuration file is broken.") };
    }

    void checkServerAddress()
    {
        QFETCH(QString, situation);
        QFETCH(bool, reachable);
        QFETCH(QStringList, expectedWarnings);

        const quint16 port = situation == QLatin1String("closed") ? closedPort() : m_server->port();
        if (situation != QLatin1String("no settings"))
            QVERIFY(writeSettings({ { QStringLiteral("main/port"), port } }));
        HttpHelper helper;
        QString hostPort = QStringLiteral("untouched");
        QCOMPARE(helper.checkServerAddress(hostPort), reachable);
        QCOMPARE(hostPort,
            situation == QLatin1String("no settings") ? QStringLiteral("untouched")
                                                      : QStringLiteral("127.0.0.2:") + QString::number(port));
        expectedWarnings.replaceInStrings(QStringLiteral("{PORT}"), QString::number(port));
        QCOMPARE(warningMismatch(expectedWarnings), QString());
        // A probe is a bare connection, never a request.
        QVERIFY(m_server->requests().isEmpty());
    }

    void checkServerAddressWithoutEventLoop_data()
    {
        QTest::addColumn<bool>("listening");
        QTest::newRow("listening") << true;
        QTest::newRow("nothing listening") << false;
    }

    void checkServerAddressWithoutEventLoop()
    {
        QFETCH(bool, listening);
        QVERIFY(writeSettings({ { QStringLiteral("main/port"), listening ? m_server->port() : closedPort() } }));
        HttpHelper helper;
        bool reachable = !listening;
        std::thread worker([&helper, &reachable]() {
            QString hostPort;
            reachable = helper.checkServerAddress(hostPort);
        });
        worker.join();
        QCOMPARE(reachable, listening);
    }

    void configureSsl_data()
    {
        QTest::addColumn<QVariantMap>("overrides");
        QTest::addColumn<bool>("tls");
        QTest::addColumn<QStringList>("expectedWarnings");
        QTest::addColumn<bool>("ownCa");
        QTest::addColumn<bool>("clientChain");
        QTest::addColumn<bool>("clientKey");

        const QVariantMap noFiles { { QStringLiteral("url/server-cert"), QVariant() },
            { QStringLiteral("url/public-key"), QVariant() }, { QStringLiteral("url/private-key"), QVariant() } };
        QVariantMap plain = noFiles;
        plain.insert(QStringLiteral("url/protocol"), QStringLiteral("http://"));
        QTest::newRow("plain scheme, no files") << plain << false << QStringList() << false << false << false;
        QTest::newRow("plain scheme, files")
            << QVariantMap { { QStringLiteral("url/protocol"), QStringLiteral("http://") } } << false << QStringList()
            << false << false << false;
        QTest::newRow("scheme must be exactly https://")
            << QVariantMap { { QStringLiteral("url/protocol"), QStringLiteral("HTTPS://") } } << false << QStringList()
            << false << false << false;
        QTest::newRow("all files") << QVariantMap() << true << QStringList() << true << true << true;
        QTest::newRow("CA file missing")
            << QVariantMap { { QStringLiteral("url/server-cert"), QStringLiteral("{DIR}/missing.pem") } } << true
            << QStringList { QStringLiteral("server cert file is not exists. config: {DIR}/missing.pem"),
                   QStringLiteral("cannot set server key.") }
            << false << true << true;
        QTest::newRow("CA not configured") << QVariantMap { { QStringLiteral("url/server-cert"), QVariant() } } << true
                                           << QStringList { QStringLiteral("server cert file is not exists. config: "),
                                                  QStringLiteral("cannot set server key.") }
                                           << false << true << true;
        QTest::newRow("CA file holds no certificate")
            << QVariantMap { { QStringLiteral("url/server-cert"), QStringLiteral("{DIR}/data.json") } } << true
            << QStringList { QStringLiteral("cannot set server key.") } << false << true << true;
        QTest::newRow("client certificate missing")
            << QVariantMap { { QStringLiteral("url/public-key"), QStringLiteral("{DIR}/none.pem") } } << true
            << QStringList { QStringLiteral("client public key file is not exists. config: {DIR}/none.pem"),
                   QStringLiteral("cannot set local public key.") }
            << true << false << true;
        QTest::newRow("client key missing")
            << QVariantMap { { QStringLiteral("url/private-key"), QStringLiteral("{DIR}/none.key") } } << true
            << QStringList { QStringLiteral("client private key file is not exists. config: {DIR}/none.key"),
                   QStringLiteral("cannot read local private key.") }
            << true << true << false;
    }

    void configureSsl()
    {
        QFETCH(QVariantMap, overrides);
        QFETCH(bool, tls);
        QFETCH(QStringList, expectedWarnings);
        QFETCH(bool, ownCa);
        QFETCH(bool, clientChain);
        QFETCH(bool, clientKey);

        QVERIFY(writeSettings(withDirectory(overrides)));
        HttpHelper helper;
        QNetworkRequest request(QUrl(QStringLiteral("https://127.0.0.2/")));
        helper.configureSsl(request);
        expectedWarnings.replaceInStrings(QStringLiteral("{DIR}"), m_server->directory());
        QCOMPARE(warningMismatch(expectedWarnings), QString());

        const QSslConfiguration configuration = request.sslConfiguration();
        if (!tls) {
            QVERIFY(configuration == QNetworkRequest().sslConfiguration());
            return;
        }
        const QList<QSslCertificate> ca = QSslCertificate::fromPath(m_server->caFile());
        QCOMPARE(configuration.caCertificates() == ca, ownCa);
        // Without a CA of its own the client keeps the system's list, which never holds the test CA.
        QVERIFY(ownCa || !configuration.caCertificates().contains(ca.first()));
        QCOMPARE(configuration.localCertificateChain() == QSslCertificate::fromPath(m_server->clientCertificateFile()),
            clientChain);
        QCOMPARE(!configuration.privateKey().isNull(), clientKey);
        QCOMPARE(configuration.peerVerifyMode(), QSslSocket::QueryPeer);
    }

    void sendRequestSendsHeadersAndBody()
    {
        QVERIFY(writeSettings());
        HttpHelper helper;
        const std::unique_ptr<QNetworkReply> reply(helper.sendRequest(url("/v1/domain/"), "GET", R"({"a":1})", true));
        QVERIFY(reply->isFinished());
        QCOMPARE(reply->error(), QNetworkReply::NoError);
        QCOMPARE(reply->attribute(QNetworkRequest::HttpStatusCodeAttribute).toInt(), 200);
        QCOMPARE(reply->readAll(), domainReply);

        const QList<QJsonObject> requests = m_server->requests();
        QCOMPARE(requests.size(), 1);
        const QJsonObject &sent = requests.first();
        QCOMPARE(sent.value(QLatin1String("method")).toString(), QStringLiteral("GET"));
        QCOMPARE(sent.value(QLatin1String("path")).toString(), QStringLiteral("/v1/domain/"));
        QCOMPARE(sent.value(QLatin1String("body")).toString(), QStringLiteral(R"({"a":1})"));
        QCOMPARE(sent.value(QLatin1String("client")).toString(), QStringLiteral("kest-test-client"));
        const QJsonObject headers = sent.value(QLatin1String("headers")).toObject();
        QCOMPARE(headers.value(QLatin1String("content-type")).toString(), QStringLiteral("application/json"));
        QCOMPARE(headers.value(QLatin1String("user-agent")).toString(), QStringLiteral("KEST"));
        QCOMPARE(headers.value(QLatin1String("accept")).toString(), QStringLiteral("application/json"));
        QCOMPARE(warningMismatch({}), QString());
    }

    void sendRequestWithoutWaiting()
    {
        QVERIFY(writeSettings());
        HttpHelper helper;
        const std::unique_ptr<QNetworkReply> reply(helper.sendRequest(url("/v1/domain/"), "GET", QByteArray(), false));
        QVERIFY(!reply->isFinished());
        QSignalSpy finished(reply.get(), &QNetworkReply::finished);
        QVERIFY(finished.wait(10000));
        QCOMPARE(reply->readAll(), domainReply);
    }

    void replyOwnsItsManager()
    {
        QVERIFY(writeSettings());
        QVERIFY(m_server->setMisbehaviour(QStringLiteral("/v1/domain/"), QStringLiteral("delay:20000")));
        HttpHelper helper;
        auto reply = std::unique_ptr<QNetworkReply>(helper.sendRequest(url("/v1/domain/"), "GET", QByteArray(), false));
        const QPointer<QNetworkAccessManager> manager = reply->manager();
        QVERIFY(manager);
        QCOMPARE(manager->parent(), reply.get());
        QVERIFY(!reply->parent());
        // Released while still in flight: the request is dropped with it.
        reply.reset();
        QVERIFY(!manager);
    }

    void redirectsAreNotFollowed()
    {
        QVERIFY(writeSettings());
        QVERIFY(m_server->setMisbehaviour(QStringLiteral("/v1/auth/"), QStringLiteral("redirect:/v1/domain/")));
        HttpHelper helper;
        const std::unique_ptr<QNetworkReply> reply(helper.sendRequest(url("/v1/auth/"), "POST", "{}", true));
        QCOMPARE(reply->attribute(QNetworkRequest::HttpStatusCodeAttribute).toInt(), 302);
        QCOMPARE(m_server->requests().size(), 1);
    }

    void delayedReplyIsAbandoned()
    {
        QVERIFY(writeSettings({ { QStringLiteral("main/network-timeout"), 1 } }));
        QVERIFY(m_server->setMisbehaviour(QStringLiteral("/v1/domain/"), QStringLiteral("delay:20000")));
        HttpHelper helper;
        QElapsedTimer elapsed;
        elapsed.start();
        const std::unique_ptr<QNetworkReply> reply(helper.sendRequest(url("/v1/domain/"), "GET", QByteArray(), true));
        // Far below the server's delay: the client gave up on its own.
        QVERIFY(elapsed.elapsed() < 15000);
        QVERIFY(reply->isFinished());
        QCOMPARE(reply->error(), QNetworkReply::OperationCanceledError);
        QCOMPARE(m_server->requests().size(), 1);
        QCOMPARE(warningMismatch({ QStringLiteral("error code OperationCanceledError url: ") + url("/v1/domain/")
                     + QStringLiteral(", error detail: Operation canceled") }),
            QString());
    }

    void replyWithinTimeoutIsRead()
    {
        QVERIFY(writeSettings({ { QStringLiteral("main/network-timeout"), 10 } }));
        QVERIFY(m_server->setMisbehaviour(QStringLiteral("/v1/domain/"), QStringLiteral("delay:300")));
        HttpHelper helper;
        const std::unique_ptr<QNetworkReply> reply(helper.sendRequest(url("/v1/domain/"), "GET", QByteArray(), true));
        QCOMPARE(reply->error(), QNetworkReply::NoError);
        QCOMPARE(reply->readAll(), domainReply);
    }

    void refusedConnectionIsLogged()
    {
        QVERIFY(writeSettings());
        HttpHelper helper;
        const QString target = QStringLiteral("https://127.0.0.2:%1/v1/domain/").arg(closedPort());
        const std::unique_ptr<QNetworkReply> reply(helper.sendRequest(target, "GET", QByteArray(), true));
        QCOMPARE(reply->error(), QNetworkReply::ConnectionRefusedError);
        QCOMPARE(warningMismatch({ QStringLiteral("error code ConnectionRefusedError url: ") + target
                     + QStringLiteral(", error detail: Connection refused") }),
            QString());
    }

    void parseReply_data() { replyRows(); }

    void parseReply()
    {
        QFETCH(QString, behaviour);
        QFETCH(QByteArray, method);
        QFETCH(int, status);
        QFETCH(QByteArray, body);
        QFETCH(QStringList, expectedWarnings);

        QVERIFY(writeSettings());
        QVERIFY(m_server->setMisbehaviour(QStringLiteral("/v1/domain/"), behaviour));
        HttpHelper helper;
        const std::unique_ptr<QNetworkReply> reply(helper.sendRequest(url("/v1/domain/"), method, QByteArray(), true));
        QJsonDocument document;
        QCOMPARE(helper.parseReply(reply.get(), document), status);
        QCOMPARE(document.toJson(QJsonDocument::Compact), body.isEmpty() ? QByteArray() : body);
        expectedWarnings.replaceInStrings(QStringLiteral("{URL}"), url("/v1/domain/"));
        QCOMPARE(warningMismatch(expectedWarnings), QString());
    }

    void checkReplyData_data() { replyRows(); }

    void checkReplyData()
    {
        QFETCH(QString, behaviour);
        QFETCH(QByteArray, method);
        QFETCH(QByteArray, body);
        QFETCH(bool, accepted);
        QFETCH(QStringList, expectedWarnings);

        QVERIFY(writeSettings());
        QVERIFY(m_server->setMisbehaviour(QStringLiteral("/v1/domain/"), behaviour));
        HttpHelper helper;
        const std::unique_ptr<QNetworkReply> reply(helper.sendRequest(url("/v1/domain/"), method, QByteArray(), true));
        QJsonObject object;
        QCOMPARE(helper.checkReplyData(reply.get(), object), accepted);
        if (accepted)
            QCOMPARE(QJsonDocument(object).toJson(QJsonDocument::Compact), body);
        else
            expectedWarnings << QStringLiteral("http response data error. url: {URL}");
        expectedWarnings.replaceInStrings(QStringLiteral("{URL}"), url("/v1/domain/"));
        QCOMPARE(warningMismatch(expectedWarnings), QString());
    }

    void certificateErrors_data()
    {
        QTest::addColumn<bool>("foreignCa");
        QTest::newRow("server signed by the configured CA") << false;
        QTest::newRow("server not signed by the configured CA") << true;
    }

    void certificateErrors()
    {
        QFETCH(bool, foreignCa);
        QTemporaryDir other;
        if (foreignCa) {
            QVERIFY(DomainServerFixture::makeCertificates(other.path()));
            QVERIFY(writeSettings({ { QStringLiteral("url/server-cert"), other.filePath(QStringLiteral("ca.pem")) } }));
        } else {
            QVERIFY(writeSettings());
        }
        HttpHelper helper;
        const std::unique_ptr<QNetworkReply> reply(helper.sendRequest(url("/v1/domain/"), "GET", QByteArray(), true));
        // The server is addressed by a literal address, so certificate errors are reported, not fatal.
        QCOMPARE(reply->error(), QNetworkReply::NoError);
        QCOMPARE(reply->readAll(), domainReply);
        const QStringList logged = HttpTestSupport::warnings();
        if (!foreignCa) {
            QCOMPARE(logged, QStringList());
            return;
        }
        QCOMPARE(logged.size(), 1);
        QVERIFY2(logged.first().startsWith(
                     QStringLiteral("ssl error url: ") + url("/v1/domain/") + QStringLiteral(" certificate error: ")),
            qPrintable(logged.first()));
        // Each error on a line of its own; the message handler turns line breaks into ". ".
        QVERIFY2(logged.first().contains(QStringLiteral(".     certificate error: ")), qPrintable(logged.first()));
    }

    void readMachineId_data()
    {
        QTest::addColumn<QByteArray>("content"); // null: no file
        QTest::addColumn<QString>("expected");
        QTest::newRow("first of several lines") << QByteArray("machine-1\nsecond\n") << QStringLiteral("machine-1");
        QTest::newRow("no line break") << QByteArray("machine-1") << QStringLiteral("machine-1");
        QTest::newRow("empty file") << QByteArray("") << QString();
        QTest::newRow("no file") << QByteArray() << QString();
    }

    void readMachineId()
    {
        QFETCH(QByteArray, content);
        QFETCH(QString, expected);
        if (!content.isNull())
            QVERIFY(m_root->writeFile(QStringLiteral("/usr/share/kest/machine.txt"), content));
        HttpHelper helper;
        QCOMPARE(helper.readMachineId(), expected);
        const QStringList expectedWarnings = content.isNull()
            ? QStringList { QStringLiteral("cannot read machine id file: ") + KestPaths::machineIdFile() }
            : QStringList();
        QCOMPARE(warningMismatch(expectedWarnings), QString());
    }

private:
    void replyRows()
    {
        QTest::addColumn<QString>("behaviour");
        QTest::addColumn<QByteArray>("method");
        QTest::addColumn<int>("status");
        QTest::addColumn<QByteArray>("body"); // compact JSON; empty: no document
        QTest::addColumn<bool>("accepted");
        QTest::addColumn<QStringList>("expectedWarnings");

        QJsonParseError notJson;
        QJsonDocument::fromJson("this is not json", &notJson);
        QJsonParseError empty;
        QJsonDocument::fromJson(QByteArray(), &empty);

        QTest::newRow("ok") << QString() << QByteArray("GET") << 200 << domainReply << true << QStringList();
        QTest::newRow("not JSON") << QStringLiteral("not-json") << QByteArray("PATCH") << 200 << QByteArray() << false
                                  << QStringList { QStringLiteral("invalid reply data, parse error: ")
                                         + notJson.errorString()
                                         + QStringLiteral(", raw data: this is not json, http status: 200, "
                                                          "url: {URL}, method: PATCH") };
        QTest::newRow("no msg") << QStringLiteral("no-msg") << QByteArray("GET") << 200
                                << QByteArray(R"({"code":0,"data":null})") << false << QStringList();
        QTest::newRow("status 404 with a JSON body")
            << QStringLiteral("status:404") << QByteArray("GET") << 404 << domainReply << true
            << QStringList { QStringLiteral("error code ContentNotFoundError url: {URL}, error detail: *"),
                   QStringLiteral("http response status is not ok. actual http status code: 404") };
        QTest::newRow("connection closed")
            << QStringLiteral("close") << QByteArray("GET") << 0 << QByteArray() << false
            << QStringList { QStringLiteral("error code RemoteHostClosedError url: {URL}, error detail: *"),
                   QStringLiteral("invalid reply data, parse error: ") + empty.errorString()
                       + QStringLiteral(", raw data: , http status: 0, url: {URL}, method: GET"),
                   QStringLiteral("http response status is not ok. actual http status code: 0") };
    }

    bool writeSettings(const QVariantMap &overrides = QVariantMap())
    {
        return m_root->writeSettings(m_server->settingsIni(overrides));
    }

    QVariantMap withDirectory(QVariantMap overrides) const
    {
        for (auto it = overrides.begin(); it != overrides.end(); ++it) {
            if (it.value().type() == QVariant::String)
                it.value() = it.value().toString().replace(QStringLiteral("{DIR}"), m_server->directory());
        }
        return overrides;
    }

    QString url(const char *path) const
    {
        return QStringLiteral("https://127.0.0.2:") + QString::number(m_server->port()) + QLatin1String(path);
    }

    std::unique_ptr<DomainServerFixture> m_server;
    std::unique_ptr<TestRoot> m_root;
};

QTEST_GUILESS_MAIN(HttpHelperTest)
#include "test_httphelper.moc"
