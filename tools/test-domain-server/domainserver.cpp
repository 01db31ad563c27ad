#include "domainserver.h"

#include "httpconnection.h"
#include "misbehaviour.h"

#include <QFile>
#include <QJsonDocument>
#include <QJsonObject>
#include <QSslCertificate>
#include <QSslKey>
#include <QSslSocket>

DomainServer::DomainServer(
    const QString &dataFile, const QString &behaviourFile, const QString &logFile, QObject *parent)
    : QTcpServer(parent)
    , m_directory(dataFile)
    , m_behaviourFile(behaviourFile)
    , m_logFile(logFile)
{
}

bool DomainServer::setTls(const QString &certificateFile, const QString &keyFile, const QString &caFile, QString &error)
{
    const QList<QSslCertificate> certificates = QSslCertificate::fromPath(certificateFile);
    const QList<QSslCertificate> authorities = QSslCertificate::fromPath(caFile);
    QFile file(keyFile);
    if (certificates.isEmpty() || authorities.isEmpty() || !file.open(QIODevice::ReadOnly)) {
        error = QStringLiteral("cannot read the certificate, its key or the CA certificate");
        return false;
    }
    const QSslKey key(&file, QSsl::Rsa, QSsl::Pem, QSsl::PrivateKey);
    if (key.isNull()) {
        error = QStringLiteral("not a PEM RSA private key: ") + keyFile;
        return false;
    }
    m_tls = QSslConfiguration::defaultConfiguration();
    m_tls.setLocalCertificateChain(certificates);
    m_tls.setPrivateKey(key);
    m_tls.setCaCertificates(authorities);
    m_tls.setPeerVerifyMode(QSslSocket::VerifyPeer);
    m_useTls = true;
    return true;
}

void DomainServer::incomingConnection(qintptr descriptor)
{
    QTcpSocket *socket = m_useTls ? new QSslSocket(this) : new QTcpSocket(this);
    if (!socket->setSocketDescriptor(descriptor)) {
        delete socket;
        return;
    }
    // Probes that connect and leave, failed handshakes and finished answers all end here.
    connect(socket, &QTcpSocket::disconnected, socket, &QObject::deleteLater);
    connect(socket, &QTcpSocket::errorOccurred, socket, &QObject::deleteLater);
    new HttpConnection(socket, ++m_connections,
        [this](HttpConnection *connection, const HttpRequest &request) { handle(connection, request); });
    if (auto *ssl = qobject_cast<QSslSocket *>(socket)) {
        ssl->setSslConfiguration(m_tls);
        ssl->startServerEncryption();
    }
}

void DomainServer::handle(HttpConnection *connection, const HttpRequest &request)
{
    logRequest(connection, request);
    const Misbehaviour behaviour = Misbehaviour::forPath(m_behaviourFile, request.path);
    switch (behaviour.kind()) {
    case Misbehaviour::Kind::NotJson:
        connection->respond(HttpResponse { 200, "this is not json" });
        return;
    case Misbehaviour::Kind::NoMsg:
        connection->respond(HttpResponse { 200, R"({"code":0,"data":null})" });
        return;
    case Misbehaviour::Kind::Close:
        connection->close();
        return;
    case Misbehaviour::Kind::Redirect:
        connection->respond(
            HttpResponse { 302, R"({"code":302,"msg":"moved","data":null})", { { "Location", behaviour.target() } } });
        return;
    case Misbehaviour::Kind::Status: {
        HttpResponse response = m_directory.answer(request);
        response.status = behaviour.value();
        connection->respond(response);
        return;
    }
    case Misbehaviour::Kind::Delay:
        connection->respondLater(behaviour.value(), m_directory.answer(request));
        return;
    case Misbehaviour::Kind::None:
        connection->respond(m_directory.answer(request));
        return;
    }
}

void DomainServer::logRequest(const HttpConnection *connection, const HttpRequest &request) const
{
    if (m_logFile.isEmpty())
        return;
    QJsonObject headers;
    for (auto it = request.headers.cbegin(); it != request.headers.cend(); ++it)
        headers.insert(QString::fromLatin1(it.key()), QString::fromLatin1(it.value()));
    const QJsonObject line { { QStringLiteral("method"), QString::fromLatin1(request.method) },
        { QStringLiteral("path"), QString::fromLatin1(request.path) }, { QStringLiteral("headers"), headers },
        { QStringLiteral("body"), QString::fromUtf8(request.body) },
        { QStringLiteral("client"), connection->clientName() },
        { QStringLiteral("connection"), connection->serial() } };
    QFile file(m_logFile);
    if (file.open(QIODevice::WriteOnly | QIODevice::Append))
        file.write(QJsonDocument(line).toJson(QJsonDocument::Compact) + '\n');
}
