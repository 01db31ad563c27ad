#include "httphelper.h"

#include "globalsetting.h"
#include "kestpaths.h"

#include <QDebug>
#include <QEventLoop>
#include <QFile>
#include <QHostAddress>
#include <QJsonArray>
#include <QJsonParseError>
#include <QMetaEnum>
#include <QNetworkAccessManager>
#include <QNetworkRequest>
#include <QSslCertificate>
#include <QSslConfiguration>
#include <QSslKey>
#include <QSslSocket>
#include <QTcpSocket>
#include <QTextStream>
#include <QTimer>
#include <QUrl>

#include <initializer_list>
#include <memory>
#include <utility>

namespace
{
const int connectTimeoutMs = 5000;

void warn(const QString &text)
{
    qWarning().noquote() << text;
}

// Empty paths are refused here so that Qt does not log a complaint of its own about them.
QList<QSslCertificate> certificatesIn(const QString &path)
{
    if (path.isEmpty())
        return QList<QSslCertificate>();
    QFile file(path);
    if (!file.open(QIODevice::ReadOnly))
        return QList<QSslCertificate>();
    return QSslCertificate::fromData(file.readAll(), QSsl::Pem);
}

bool isLiteralAddress(const QString &host)
{
    QHostAddress address;
    return address.setAddress(host);
}

QByteArray jsonText(const QJsonValue &value)
{
    const QByteArray wrapped = QJsonDocument(QJsonArray { value }).toJson(QJsonDocument::Compact);
    return wrapped.mid(1, wrapped.size() - 2);
}

// The server reads some bodies in the order their members are written, which QJsonObject would sort.
QByteArray jsonObjectText(std::initializer_list<std::pair<const char *, QByteArray>> members)
{
    QByteArray text("{");
    for (const auto &member : members) {
        if (text.size() > 1)
            text += ',';
        text += jsonText(QString::fromLatin1(member.first)) + ':' + member.second;
    }
    return text + '}';
}

QString compactText(const QJsonObject &object)
{
    return QString::fromUtf8(QJsonDocument(object).toJson(QJsonDocument::Compact));
}

// The server knows domain accounts without the local "@"; the caller's own name is put back.
QJsonObject withLocalName(QJsonObject object, const QString &localName)
{
    QJsonObject data = object.value(QLatin1String("data")).toObject();
    if (!data.value(QLatin1String("user")).isObject())
        return object;
    QJsonObject user = data.value(QLatin1String("user")).toObject();
    user.insert(QStringLiteral("name"), localName);
    data.insert(QStringLiteral("user"), user);
    object.insert(QStringLiteral("data"), data);
    return object;
}
} // namespace

HttpHelper::HttpHelper(QObject *parent)
    : QObject(parent)
{
}

const QString &HttpHelper::refusedReply()
{
    static const QString text = QStringLiteral("{\"code\": -1,\"msg\": \"web server refuse login.\"}");
    return text;
}

const QString &HttpHelper::unreachableReply()
{
    static const QString text = QStringLiteral("{\"code\": -2,\"msg\": \"client cannot connect to server.\"}");
    return text;
}

const QString &HttpHelper::unknownAccountReply()
{
    static const QString text = QStringLiteral("{\"code\": -3,\"msg\": \"network account does not exist.\"}");
    return text;
}

bool HttpHelper::checkServerAddress(QString &hostPort)
{
    if (!QFile::exists(KestPaths::settingsFile())) {
        warn(QStringLiteral("configuration file is broken."));
        return false;
    }
    const GlobalSetting *settings = GlobalSetting::instance();
    const QString address = settings->serverAddress();
    const int port = settings->port();
    hostPort = QStringLiteral("%1:%2").arg(address, QString::number(port));

    // Blocking calls only: the update worker probes from a thread that has no event loop.
    QTcpSocket socket;
    socket.connectToHost(QHostAddress(address), static_cast<quint16>(port));
    socket.waitForConnected(connectTimeoutMs);
    if (socket.state() != QAbstractSocket::ConnectedState) {
        warn(QStringLiteral("error host address: ") + hostPort + QStringLiteral(", error detail: ")
            + socket.errorString());
        return false;
    }
    return true;
}

void HttpHelper::configureSsl(QNetworkRequest &request)
{
    const GlobalSetting *settings = GlobalSetting::instance();
    if (settings->protocol() != QLatin1String("https://"))
        return;

    QSslConfiguration configuration = QSslConfiguration::defaultConfiguration();
    const QList<QSslCertificate> authorities = certificatesIn(settings->serverCert());
    if (authorities.isEmpty())
        warn(QStringLiteral("cannot set server key."));
    else
        configuration.setCaCertificates(authorities);

    const QList<QSslCertificate> chain = certificatesIn(settings->publicKey());
    if (chain.isEmpty())
        warn(QStringLiteral("cannot set local public key."));
    else
        configuration.setLocalCertificateChain(chain);

    const QString keyPath = settings->privateKey();
    QFile keyFile(keyPath);
    if (keyPath.isEmpty() || !keyFile.open(QIODevice::ReadOnly))
        warn(QStringLiteral("cannot read local private key."));
    else
        configuration.setPrivateKey(QSslKey(&keyFile, QSsl::Rsa, QSsl::Pem, QSsl::PrivateKey));

    // A certificate cannot name every address a server is reached by; onSslError goes on likewise.
    if (isLiteralAddress(settings->serverAddress()))
        configuration.setPeerVerifyMode(QSslSocket::QueryPeer);
    request.setSslConfiguration(configuration);
}

QNetworkReply *HttpHelper::sendRequest(const QString &url, const QByteArray &method, const QByteArray &body, bool wait)
{
    QNetworkRequest request { QUrl(url) };
    request.setHeader(QNetworkRequest::ContentTypeHeader, QStringLiteral("application/json"));
    request.setHeader(QNetworkRequest::UserAgentHeader, QStringLiteral("KEST"));
    request.setAttribute(QNetworkRequest::RedirectPolicyAttribute, QNetworkRequest::ManualRedirectPolicy);
    // Empty, not null (a null value removes a header): Qt's HTTP layer then puts in its own values.
    const QByteArray empty("");
    request.setRawHeader("Connection", empty);
    request.setRawHeader("Accept-Encoding", empty);
    request.setRawHeader("Accept-Language", empty);
    request.setRawHeader("Accept", "application/json");
    configureSsl(request);

    auto manager = std::make_unique<QNetworkAccessManager>();
    // Direct: the decision to ignore the errors must be taken before the handshake goes on.
    connect(manager.get(), &QNetworkAccessManager::sslErrors, this, &HttpHelper::onSslError, Qt::DirectConnection);
    QNetworkReply *reply = manager->sendCustomRequest(request, method, body);
    // The reply owns its manager, so that releasing the reply releases everything.
    reply->setParent(nullptr);
    manager.release()->setParent(reply);
    connect(reply, &QNetworkReply::errorOccurred, this, &HttpHelper::onReplyError);

    auto *timeout = new QTimer(reply);
    timeout->setSingleShot(true);
    connect(timeout, &QTimer::timeout, reply, &QNetworkReply::abort);
    connect(reply, &QNetworkReply::finished, timeout, &QTimer::stop);
    timeout->start(GlobalSetting::instance()->networkTimeout() * 1000);

    if (wait && !reply->isFinished()) {
        QEventLoop loop;
        connect(reply, &QNetworkReply::finished, &loop, &QEventLoop::quit);
        loop.exec();
    }
    return reply;
}

int HttpHelper::parseReply(QNetworkReply *reply, QJsonDocument &document)
{
    const int status = reply->attribute(QNetworkRequest::HttpStatusCodeAttribute).toInt();
    // An aborted reply is closed, and reading a closed device makes Qt log a complaint of its own.
    const QByteArray data = reply->isOpen() ? reply->readAll() : QByteArray();
    QJsonParseError error;
    document = QJsonDocument::fromJson(data, &error);
    if (error.error != QJsonParseError::NoError) {
        // The verb is the one sent; "Request Method" is not a header name that may go on the wire.
        const QByteArray method = reply->request().attribute(QNetworkRequest::CustomVerbAttribute).toByteArray();
        warn(QStringLiteral("invalid reply data, parse error: ") + error.errorString() + QStringLiteral(", raw data: ")
            + QString::fromUtf8(data) + QStringLiteral(", http status: ") + QString::number(status)
            + QStringLiteral(", url: ") + reply->url().toString() + QStringLiteral(", method: ")
            + QString::fromLatin1(method));
    }
    if (status != 200)
        warn(QStringLiteral("http response status is not ok. actual http status code: ") + QString::number(status));
    return status;
}

bool HttpHelper::checkReplyData(QNetworkReply *reply, QJsonObject &object)
{
    QJsonDocument document;
    parseReply(reply, document);
    object = document.object();
    if (!document.isObject() || !object.contains(QLatin1String("code")) || !object.contains(QLatin1String("msg"))) {
        warn(QStringLiteral("http response data error. url: ") + reply->url().toString());
        return false;
    }
    return true;
}

QString HttpHelper::readMachineId()
{
    QFile file(KestPaths::machineIdFile());
    if (!file.open(QIODevice::ReadOnly | QIODevice::Text)) {
        warn(QStringLiteral("cannot read machine id file: ") + file.fileName());
        return QString();
    }
    return QTextStream(&file).readLine();
}

bool HttpHelper::exchange(
    PathSetting path, const QByteArray &method, const BodyBuilder &body, QJsonObject &object, QString &failure)
{
    QString hostPort;
    if (!checkServerAddress(hostPort)) {
        failure = unreachableReply();
        return false;
    }
    const GlobalSetting *settings = GlobalSetting::instance();
    const QString url = settings->protocol() + hostPort + (settings->*path)();
    const std::unique_ptr<QNetworkReply> reply(sendRequest(url, method, body(), true));
    if (!checkReplyData(reply.get(), object)) {
        failure = refusedReply();
        return false;
    }
    return true;
}

QString HttpHelper::call(PathSetting path, const QByteArray &method, const BodyBuilder &body)
{
    QJsonObject object;
    QString failure;
    if (!exchange(path, method, body, object, failure))
        return failure;
    return compactText(object);
}

QString HttpHelper::queryUserByName(const QString &name)
{
    // Domain accounts are named "@user" on this machine; anything else is never asked for.
    if (!name.startsWith(QLatin1Char('@')))
        return unknownAccountReply();
    const auto body = [&name]() {
        return jsonObjectText(
            { { "username", jsonText(name.mid(1)) }, { "domain", jsonText(GlobalSetting::instance()->domain()) } });
    };
    QJsonObject object;
    QString failure;
    if (!exchange(&GlobalSetting::userUrl, "GET", body, object, failure))
        return failure;
    return compactText(withLocalName(object, name));
}

QString HttpHelper::queryUserByUid(uint uid)
{
    return call(&GlobalSetting::userUrl, "GET", [uid]() {
        return jsonObjectText({ { "uid", QByteArray::number(uid) } });
    });
}

QString HttpHelper::authenticate(const QString &username, const QString &password, const QString &method)
{
    const auto body = [&]() {
        const QByteArray data = jsonObjectText({ { "username", jsonText(username) }, { "password", jsonText(password) },
            { "machine_id", jsonText(readMachineId()) } });
        return jsonObjectText({ { "data", data }, { "method", jsonText(method) } });
    };
    return call(&GlobalSetting::authUrl, "POST", body);
}

QString HttpHelper::queryGroupByName(const QString &name)
{
    return call(&GlobalSetting::groupUrl, "GET", [&name]() {
        return jsonObjectText({ { "groupname", jsonText(name) } });
    });
}

QString HttpHelper::queryGroupByGid(uint gid)
{
    return call(&GlobalSetting::groupUrl, "GET", [gid]() {
        return jsonObjectText({ { "gid", QByteArray::number(gid) } });
    });
}

QString HttpHelper::resetPassword(
    uint uid, const QString &username, const QString &password, const QString &oldPassword)
{
    const auto body = [&]() {
        return jsonObjectText({ { "uid", QByteArray::number(uid) }, { "username", jsonText(username) },
            { "password", jsonText(password) }, { "old_password", jsonText(oldPassword) } });
    };
    return call(&GlobalSetting::resetPasswordUrl, "PATCH", body);
}

QString HttpHelper::queryDomain()
{
    return call(&GlobalSetting::domainUrl, "GET", []() { return QByteArray(); });
}

void HttpHelper::onSslError(QNetworkReply *reply, const QList<QSslError> &errors)
{
    if (isLiteralAddress(reply->url().host()))
        reply->ignoreSslErrors(errors);
    QString text = QStringLiteral("ssl error url: ") + reply->url().toString() + QStringLiteral(" certificate error: ")
        + reply->errorString();
    for (const QSslError &error : errors)
        text += QStringLiteral("\n    certificate error: ") + error.errorString();
    warn(text);
}

void HttpHelper::onReplyError(QNetworkReply::NetworkError error)
{
    const auto *reply = qobject_cast<const QNetworkReply *>(sender());
    const QMetaObject &meta = QNetworkReply::staticMetaObject;
    const QMetaEnum names = meta.enumerator(meta.indexOfEnumerator("NetworkError"));
    warn(QStringLiteral("error code ") + QString::fromLatin1(names.valueToKey(error)) + QStringLiteral(" url: ")
        + (reply ? reply->url().toString() : QString()) + QStringLiteral(", error detail: ")
        + (reply ? reply->errorString() : QString()));
}
