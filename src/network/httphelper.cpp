#include "httphelper.h"

#include "clientcredentials.h"
#include "globalsetting.h"
#include "kestpaths.h"
#include "serverreachability.h"
#include "settingsfile.h"

#include <QDebug>
#include <QFile>
#include <QHostAddress>
#include <QJsonArray>
#include <QJsonParseError>
#include <QMetaEnum>
#include <QNetworkProxy>
#include <QSslCertificate>
#include <QSslKey>
#include <QSslSocket>
#include <QTcpSocket>
#include <QTextStream>
#include <QUrl>

#include <algorithm>
#include <initializer_list>
#include <memory>
#include <utility>

namespace
{
const int connectTimeoutMs = 5000;
const int probeSliceMs = 100;

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

QString hostPortText(const QString &address, int port)
{
    const bool ipv6 = QHostAddress(address).protocol() == QAbstractSocket::IPv6Protocol;
    return (ipv6 ? QLatin1Char('[') + address + QLatin1Char(']') : address) + QLatin1Char(':') + QString::number(port);
}

QByteArray requestText(const QString &path, const QString &hostPort, const QByteArray &method, const QByteArray &body)
{
    const QByteArray target = path.startsWith(QLatin1Char('/')) ? path.toUtf8() : '/' + path.toUtf8();
    return method + ' ' + target + " HTTP/1.1\r\nHost: " + hostPort.toUtf8()
        + "\r\nContent-Type: application/json\r\nUser-Agent: KEST\r\nAccept: application/json\r\n"
          "Connection: keep-alive\r\nContent-Length: "
        + QByteArray::number(body.size()) + "\r\n\r\n" + body;
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

HttpHelper::HttpHelper(std::shared_ptr<ServerReachability> reachability, QObject *parent)
    : QObject(parent)
    , m_reachability(reachability ? std::move(reachability) : std::make_shared<ServerReachability>())
{
}

HttpHelper::~HttpHelper() = default;

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

QDeadlineTimer HttpHelper::requestDeadline(int milliseconds) const
{
    const QDeadlineTimer own(milliseconds);
    return own.deadlineNSecs() < m_callDeadline.deadlineNSecs() ? own : m_callDeadline;
}

bool HttpHelper::checkServerAddress(QString &hostPort, const std::atomic<bool> *cancel)
{
    const SettingsFile::OneLook settingsOnce;
    if (!SettingsFile::exists()) {
        SettingsFile::warnOncePerVersion(QStringLiteral("configuration file is broken."));
        return false;
    }
    const GlobalSetting *settings = GlobalSetting::instance();
    const QString address = settings->serverAddress();
    const int port = settings->port();
    hostPort = hostPortText(address, port);

    // Blocking calls only: the update worker probes from a thread that has no event loop.
    QTcpSocket socket;
    socket.setProxy(QNetworkProxy::NoProxy);
    socket.connectToHost(QHostAddress(address), static_cast<quint16>(port));
    const QDeadlineTimer deadline = requestDeadline(connectTimeoutMs);
    while (socket.state() != QAbstractSocket::ConnectedState && socket.state() != QAbstractSocket::UnconnectedState
        && !deadline.hasExpired() && !(cancel && cancel->load()))
        socket.waitForConnected(int(qBound<qint64>(0, deadline.remainingTime(), probeSliceMs)));
    if (socket.state() != QAbstractSocket::ConnectedState) {
        const QString detail = socket.state() == QAbstractSocket::UnconnectedState
            ? socket.errorString()
            : QStringLiteral("Socket operation timed out");
        m_reachability->markUnreachable(hostPort, detail);
        return false;
    }
    if (settings->protocol() == QLatin1String("https://")) {
        refreshTls(isLiteralAddress(settings->ip()));
        if (!m_clientProblem.isEmpty()) {
            m_reachability->markUnreachable(hostPort, m_clientProblem);
            return false;
        }
    }
    m_reachability->markReachable();
    return true;
}

bool HttpHelper::configureSsl(bool literalAddress, QSslConfiguration &configuration)
{
    refreshTls(literalAddress);
    if (!m_tlsOwnAuthorities)
        warn(QStringLiteral("cannot set server key."));
    configuration = m_tlsConfiguration;
    return m_tlsUsable;
}

void HttpHelper::refreshTls(bool literalAddress)
{
    const GlobalSetting *settings = GlobalSetting::instance();
    const QString caPath = settings->serverCert();
    const QString chainPath = settings->publicKey();
    const QString keyPath = settings->privateKey();
    const QStringList paths { caPath, chainPath, keyPath };
    QVector<FileVersion> versions;
    for (const QString &path : paths)
        versions.append(FileVersion::of(path));
    if (m_tlsSettled && paths == m_tlsPaths && versions == m_tlsVersions && literalAddress == m_tlsLiteral)
        return;
    m_tlsPaths = paths;
    m_tlsVersions = versions;
    m_tlsLiteral = literalAddress;
    m_tlsSettled = std::all_of(versions.cbegin(), versions.cend(), [](const FileVersion &v) { return v.isSettled(); });
    ++m_tlsGeneration;
    m_tlsConfiguration = QSslConfiguration::defaultConfiguration();
    m_tlsConfiguration.setPeerVerifyMode(QSslSocket::VerifyPeer);
    m_tlsConfiguration.setSslOption(QSsl::SslOptionDisableSessionPersistence, false);
    // Exactly the configured authorities: the system's store would let any public CA vouch for an impostor.
    const QList<QSslCertificate> authorities = certificatesIn(caPath);
    m_tlsOwnAuthorities = !authorities.isEmpty();
    m_tlsUsable = m_tlsOwnAuthorities || !literalAddress;
    if (m_tlsOwnAuthorities)
        m_tlsConfiguration.setCaCertificates(authorities);
    const ClientCredentials credentials = ClientCredentials::load(chainPath, keyPath);
    m_clientProblem = credentials.problem();
    if (credentials.chain().isEmpty())
        warn(QStringLiteral("cannot set local public key."));
    else
        m_tlsConfiguration.setLocalCertificateChain(credentials.chain());
    if (!ClientCredentials::unreadableReason(keyPath).isEmpty())
        warn(QStringLiteral("cannot read local private key."));
    else
        m_tlsConfiguration.setPrivateKey(credentials.key());
}

bool HttpHelper::resolveTarget(Target &target)
{
    const GlobalSetting *settings = GlobalSetting::instance();
    const QString host = settings->ip();
    const bool literal = isLiteralAddress(host);
    const QString address = literal ? host : settings->serverAddress();
    const int port = settings->port();
    target.hostPort = hostPortText(address, port);
    target.endpoint.address = QHostAddress(address);
    target.endpoint.port = quint16(port);
    target.endpoint.tls = settings->protocol() == QLatin1String("https://");
    target.endpoint.verifyName = literal ? QString() : host;
    QSslConfiguration configuration;
    if (target.endpoint.tls && !configureSsl(literal, configuration))
        return false;
    // Without its own certificate and key the client would only be refused: treated as an outage instead.
    if (target.endpoint.tls && !m_clientProblem.isEmpty()) {
        m_reachability->markUnreachable(target.hostPort, m_clientProblem);
        return false;
    }
    target.endpoint.tlsGeneration = target.endpoint.tls ? m_tlsGeneration : 0;
    m_connection.setEndpoint(target.endpoint, configuration);
    return true;
}

DomainExchange HttpHelper::sendRequest(const QString &url, const QByteArray &method, const QByteArray &body)
{
    const QUrl parsed(url);
    const QString path = parsed.path(QUrl::FullyEncoded)
        + (parsed.hasQuery() ? QLatin1Char('?') + parsed.query(QUrl::FullyEncoded) : QString());
    const QString hostPort = parsed.authority(QUrl::FullyEncoded);
    const QDeadlineTimer connectDeadline = requestDeadline(connectTimeoutMs);
    const QDeadlineTimer deadline = requestDeadline(GlobalSetting::instance()->networkTimeout() * 1000);
    return m_connection.exchange(requestText(path, hostPort, method, body), connectDeadline, deadline);
}

int HttpHelper::parseReply(
    const QString &url, const QByteArray &method, const DomainExchange &reply, QJsonDocument &document)
{
    const int status = reply.status;
    QJsonParseError error;
    document = QJsonDocument::fromJson(reply.body, &error);
    if (error.error != QJsonParseError::NoError) {
        warn(QStringLiteral("invalid reply data, parse error: ") + error.errorString() + QStringLiteral(", raw data: ")
            + QString::fromUtf8(reply.body) + QStringLiteral(", http status: ") + QString::number(status)
            + QStringLiteral(", url: ") + url + QStringLiteral(", method: ") + QString::fromLatin1(method));
    }
    if (status != 200)
        warn(QStringLiteral("http response status is not ok. actual http status code: ") + QString::number(status));
    return status;
}

bool HttpHelper::checkReplyData(
    const QString &url, const QByteArray &method, const DomainExchange &reply, QJsonObject &object)
{
    QJsonDocument document;
    parseReply(url, method, reply, document);
    object = document.object();
    if (!document.isObject() || !object.contains(QLatin1String("code")) || !object.contains(QLatin1String("msg"))) {
        warn(QStringLiteral("http response data error. url: ") + url);
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
    const SettingsFile::OneLook settingsOnce;
    failure = unreachableReply();
    m_lastAnswered = false;
    if (!SettingsFile::exists()) {
        SettingsFile::warnOncePerVersion(QStringLiteral("configuration file is broken."));
        return false;
    }
    if (m_reachability->isUnreachable())
        return false;
    Target target;
    if (!resolveTarget(target))
        return false;
    const GlobalSetting *settings = GlobalSetting::instance();
    const QString url = settings->protocol() + target.hostPort + (settings->*path)();
    const DomainExchange reply = sendRequest(url, method, body());
    m_lastAnswered = reply.status != 0;
    if (m_lastAnswered)
        m_reachability->noteContact();
    if (!reply.connected) {
        m_reachability->markUnreachable(target.hostPort, reply.connectError);
        return false;
    }
    if (reply.untrusted) {
        onSslError(url, reply);
        return false;
    }
    if (reply.error != QNetworkReply::NoError)
        onReplyError(reply.error, url, reply.errorText);
    failure = refusedReply();
    return checkReplyData(url, method, reply, object);
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

void HttpHelper::onSslError(const QString &url, const DomainExchange &reply)
{
    QString text = QStringLiteral("ssl error url: ") + url + QStringLiteral(" certificate error: ") + reply.errorText;
    for (const QSslError &error : reply.sslErrors)
        text += QStringLiteral("\n    certificate error: ") + error.errorString();
    warn(text);
}

void HttpHelper::onReplyError(QNetworkReply::NetworkError error, const QString &url, const QString &detail)
{
    const QMetaObject &meta = QNetworkReply::staticMetaObject;
    const QMetaEnum names = meta.enumerator(meta.indexOfEnumerator("NetworkError"));
    warn(QStringLiteral("error code ") + QString::fromLatin1(names.valueToKey(error)) + QStringLiteral(" url: ") + url
        + QStringLiteral(", error detail: ") + detail);
}
