#include "httpconnection.h"

#include <QSslCertificate>
#include <QSslSocket>
#include <QTimer>

namespace
{
QByteArray reasonPhrase(int status)
{
    switch (status) {
    case 200:
        return "OK";
    case 302:
        return "Found";
    case 400:
        return "Bad Request";
    case 404:
        return "Not Found";
    case 405:
        return "Method Not Allowed";
    case 413:
        return "Payload Too Large";
    case 500:
        return "Internal Server Error";
    }
    return "Status";
}
} // namespace

HttpConnection::HttpConnection(QTcpSocket *socket, int serial, const Handler &handler)
    : QObject(socket)
    , m_socket(socket)
    , m_serial(serial)
    , m_handler(handler)
{
    connect(socket, &QTcpSocket::readyRead, this, &HttpConnection::readRequest);
}

void HttpConnection::respond(const HttpResponse &response)
{
    if (m_answered)
        return;
    m_answered = true;
    QByteArray message = "HTTP/1.1 " + QByteArray::number(response.status) + ' ' + reasonPhrase(response.status)
        + "\r\nContent-Type: application/json\r\nContent-Length: " + QByteArray::number(response.body.size())
        + (m_keepAlive ? "\r\nConnection: keep-alive\r\n" : "\r\nConnection: close\r\n");
    for (auto it = response.headers.cbegin(); it != response.headers.cend(); ++it)
        message += it.key() + ": " + it.value() + "\r\n";
    m_socket->write(message + "\r\n" + response.body);
    if (!m_keepAlive) {
        m_socket->disconnectFromHost();
        return;
    }
    m_parser = HttpRequestParser();
    m_answered = false;
    if (m_socket->bytesAvailable() > 0)
        readRequest();
}

void HttpConnection::respondLater(int milliseconds, const HttpResponse &response)
{
    // Tied to this connection: a client that gave up takes the pending answer with it.
    QTimer::singleShot(milliseconds, this, [this, response]() { respond(response); });
}

void HttpConnection::close()
{
    m_answered = true;
    m_socket->disconnectFromHost();
}

QString HttpConnection::clientName() const
{
    const auto *ssl = qobject_cast<const QSslSocket *>(m_socket);
    if (!ssl)
        return QString();
    return ssl->peerCertificate().subjectInfo(QSslCertificate::CommonName).value(0);
}

void HttpConnection::readRequest()
{
    if (m_answered)
        return;
    switch (m_parser.feed(m_socket->readAll())) {
    case HttpRequestParser::State::Incomplete:
        return;
    case HttpRequestParser::State::Invalid:
        m_keepAlive = false;
        respond(HttpResponse { 400, R"({"code":400,"msg":"malformed request","data":null})" });
        return;
    case HttpRequestParser::State::TooLarge:
        m_keepAlive = false;
        respond(HttpResponse { 413, R"({"code":413,"msg":"request too large","data":null})" });
        return;
    case HttpRequestParser::State::Complete:
        m_keepAlive = m_parser.request().headers.value("connection").toLower() != "close";
        m_handler(this, m_parser.request());
        return;
    }
}
