#include "domainconnection.h"

#include "httpreplyreader.h"

#include <QNetworkProxy>
#include <QSslSocket>

#include <cerrno>

#include <sys/socket.h>

namespace
{
int remainingMs(QDeadlineTimer deadline)
{
    return int(qMax<qint64>(0, deadline.remainingTime()));
}

// Statuses the way the rest of the client names them in its log lines.
QNetworkReply::NetworkError errorOfStatus(int status)
{
    switch (status) {
    case 401:
        return QNetworkReply::AuthenticationRequiredError;
    case 403:
        return QNetworkReply::ContentAccessDenied;
    case 404:
        return QNetworkReply::ContentNotFoundError;
    case 405:
        return QNetworkReply::ContentOperationNotPermittedError;
    case 409:
        return QNetworkReply::ContentConflictError;
    case 410:
        return QNetworkReply::ContentGoneError;
    case 500:
        return QNetworkReply::InternalServerError;
    case 501:
        return QNetworkReply::OperationNotImplementedError;
    case 503:
        return QNetworkReply::ServiceUnavailableError;
    }
    if (status >= 400 && status < 500)
        return QNetworkReply::UnknownContentError;
    if (status >= 500)
        return QNetworkReply::UnknownServerError;
    return QNetworkReply::NoError;
}

// The only error a server given by its literal address may have: its certificate cannot name it.
bool onlyNameMismatch(const QList<QSslError> &errors)
{
    for (const QSslError &error : errors) {
        if (error.error() != QSslError::HostNameMismatch)
            return false;
    }
    return true;
}
} // namespace

DomainConnection::DomainConnection() = default;

DomainConnection::~DomainConnection() = default;

void DomainConnection::setEndpoint(const DomainEndpoint &endpoint, const QSslConfiguration &configuration)
{
    if (m_hasEndpoint && endpoint == m_endpoint)
        return;
    close();
    m_endpoint = endpoint;
    m_configuration = configuration;
    m_hasEndpoint = true;
}

bool DomainConnection::isAlive() const
{
    if (!m_socket || m_socket->state() != QAbstractSocket::ConnectedState)
        return false;
    if (m_endpoint.tls && !m_socket->isEncrypted())
        return false;
    // The server may have closed an idle connection; a peek sees its end without waiting.
    char byte;
    const ssize_t peeked = recv(int(m_socket->socketDescriptor()), &byte, 1, MSG_PEEK | MSG_DONTWAIT);
    return peeked < 0 && (errno == EAGAIN || errno == EWOULDBLOCK);
}

void DomainConnection::close()
{
    if (!m_socket)
        return;
    m_socket->abort();
    m_socket.reset();
}

void DomainConnection::fail(DomainExchange &result, QNetworkReply::NetworkError error, const QString &text)
{
    result.error = error;
    result.errorText = text;
    close();
}

bool DomainConnection::connectSocket(DomainExchange &result, QDeadlineTimer connectDeadline, QDeadlineTimer deadline)
{
    m_socket = std::make_unique<QSslSocket>();
    m_socket->setProxy(QNetworkProxy::NoProxy);
    m_socket->connectToHost(m_endpoint.address, m_endpoint.port);
    if (!m_socket->waitForConnected(remainingMs(connectDeadline))) {
        result.connectError = m_socket->state() == QAbstractSocket::ConnectingState
            ? QStringLiteral("Socket operation timed out")
            : m_socket->errorString();
        close();
        return false;
    }
    result.connected = true;
    if (!m_endpoint.tls)
        return true;

    m_socket->setSslConfiguration(m_configuration);
    if (!m_endpoint.verifyName.isEmpty())
        m_socket->setPeerVerifyName(m_endpoint.verifyName);
    QSslSocket *socket = m_socket.get();
    QObject::connect(socket, QOverload<const QList<QSslError> &>::of(&QSslSocket::sslErrors),
        [socket, &result, this](const QList<QSslError> &errors) {
            if (m_endpoint.verifyName.isEmpty() && onlyNameMismatch(errors)) {
                socket->ignoreSslErrors(errors);
                return;
            }
            result.untrusted = true;
            result.sslErrors = errors;
        });
    m_socket->startClientEncryption();
    const bool encrypted = m_socket->waitForEncrypted(remainingMs(deadline));
    QObject::disconnect(socket, QOverload<const QList<QSslError> &>::of(&QSslSocket::sslErrors), nullptr, nullptr);
    if (result.untrusted) {
        fail(result, QNetworkReply::SslHandshakeFailedError, QStringLiteral("SSL handshake failed"));
        return false;
    }
    if (!encrypted) {
        const bool late = deadline.hasExpired();
        fail(result, late ? QNetworkReply::OperationCanceledError : QNetworkReply::SslHandshakeFailedError,
            late ? QStringLiteral("Operation canceled")
                 : QStringLiteral("SSL handshake failed: ") + m_socket->errorString());
        return false;
    }
    // A later connection resumes this TLS session instead of a full handshake.
    m_configuration.setSessionTicket(m_socket->sslConfiguration().sessionTicket());
    return true;
}

DomainExchange DomainConnection::exchange(
    const QByteArray &request, QDeadlineTimer connectDeadline, QDeadlineTimer deadline)
{
    DomainExchange result;
    if (isAlive()) {
        result.connected = true;
    } else {
        close();
        if (!connectSocket(result, connectDeadline, deadline))
            return result;
    }
    m_socket->write(request);
    while (m_socket->bytesToWrite() > 0) {
        if (!m_socket->waitForBytesWritten(remainingMs(deadline))) {
            fail(result, QNetworkReply::OperationCanceledError, QStringLiteral("Operation canceled"));
            return result;
        }
    }
    readReply(result, deadline);
    return result;
}

bool DomainConnection::readReply(DomainExchange &result, QDeadlineTimer deadline)
{
    HttpReplyReader reader(maximumReplyBytes);
    HttpReplyReader::State state = reader.feed(m_socket->readAll());
    while (state == HttpReplyReader::State::Incomplete) {
        if (m_socket->waitForReadyRead(remainingMs(deadline))) {
            state = reader.feed(m_socket->readAll());
            continue;
        }
        if (m_socket->state() == QAbstractSocket::ConnectedState) {
            fail(result, QNetworkReply::OperationCanceledError, QStringLiteral("Operation canceled"));
            return false;
        }
        state = reader.finish();
        if (state != HttpReplyReader::State::Complete) {
            fail(result, QNetworkReply::RemoteHostClosedError, QStringLiteral("Connection closed"));
            return false;
        }
    }
    if (state != HttpReplyReader::State::Complete) {
        fail(result, QNetworkReply::ProtocolFailure, QStringLiteral("Error reading the server's answer"));
        return false;
    }
    result.status = reader.status();
    result.body = reader.body();
    result.error = errorOfStatus(result.status);
    if (result.error != QNetworkReply::NoError)
        result.errorText = QStringLiteral("server replied: %1").arg(result.status);
    if (!reader.keepAlive())
        close();
    return true;
}
