#pragma once

#include <QSslConfiguration>
#include <QString>
#include <QTcpServer>

#include "domaindirectory.h"

class HttpConnection;
struct HttpRequest;

// HTTPS server standing in for the domain server in tests and the demonstration. Clients must
// present a certificate signed by the configured CA; with no TLS configuration it speaks plain HTTP.
class DomainServer : public QTcpServer
{
    Q_OBJECT
public:
    DomainServer(
        const QString &dataFile, const QString &behaviourFile, const QString &logFile, QObject *parent = nullptr);

    bool isReadableData(QString &error) const { return m_directory.isReadable(error); }
    // Loads the server certificate, its key and the CA of the client certificates.
    bool setTls(const QString &certificateFile, const QString &keyFile, const QString &caFile, QString &error);

protected:
    void incomingConnection(qintptr descriptor) override;

private:
    void handle(HttpConnection *connection, const HttpRequest &request);
    void logRequest(const HttpConnection *connection, const HttpRequest &request) const;

    DomainDirectory m_directory;
    QString m_behaviourFile;
    QString m_logFile;
    int m_connections = 0;
    QSslConfiguration m_tls;
    bool m_useTls = false;
};
