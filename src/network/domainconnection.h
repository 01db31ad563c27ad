#pragma once

#include <QByteArray>
#include <QDeadlineTimer>
#include <QHostAddress>
#include <QList>
#include <QNetworkReply>
#include <QSslConfiguration>
#include <QSslError>
#include <QString>

#include <functional>
#include <memory>

class QSslSocket;

// Where and how to reach the domain server; two equal endpoints may share one kept connection.
struct DomainEndpoint {
    QHostAddress address;
    quint16 port = 0;
    bool tls = false;
    QString verifyName; // empty: the server was given as a literal address
    quint64 tlsGeneration = 0; // which build of the TLS configuration the connection uses

    bool operator==(const DomainEndpoint &other) const
    {
        return address == other.address && port == other.port && tls == other.tls && verifyName == other.verifyName
            && tlsGeneration == other.tlsGeneration;
    }
};

// What came back for one request. connected is false when no TCP connection could be made at all.
struct DomainExchange {
    bool connected = false;
    bool untrusted = false; // the server's certificate was refused
    int status = 0;
    QByteArray body;
    QNetworkReply::NetworkError error = QNetworkReply::NoError;
    QString errorText;
    QString connectError;
    QList<QSslError> sslErrors;
};

// One HTTP/1.1 connection to the domain server, kept alive between requests. Every call blocks
// (no event loop runs while it waits) and ends by the deadline it is given. A request is sent once:
// a connection that closes before the answer is never asked again.
class DomainConnection
{
public:
    DomainConnection();
    ~DomainConnection();
    DomainConnection(const DomainConnection &) = delete;
    DomainConnection &operator=(const DomainConnection &) = delete;

    // Used for new connections to this endpoint; a different endpoint drops the kept connection.
    void setEndpoint(const DomainEndpoint &endpoint, const QSslConfiguration &configuration);
    bool isAlive() const;

    DomainExchange exchange(const QByteArray &request, QDeadlineTimer connectDeadline, QDeadlineTimer deadline);
    void close();

    static const int maximumReplyBytes = 16 * 1024 * 1024;

private:
    bool connectSocket(DomainExchange &result, QDeadlineTimer connectDeadline, QDeadlineTimer deadline);
    bool readReply(DomainExchange &result, QDeadlineTimer deadline);
    void fail(DomainExchange &result, QNetworkReply::NetworkError error, const QString &text);

    DomainEndpoint m_endpoint;
    QSslConfiguration m_configuration;
    bool m_hasEndpoint = false;
    std::unique_ptr<QSslSocket> m_socket;
};
