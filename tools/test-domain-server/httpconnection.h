#pragma once

#include "httpmessage.h"
#include "httprequestparser.h"

#include <QObject>
#include <QString>

#include <functional>

class QTcpSocket;

// One client connection of the test domain server: reads a single request, hands it to the
// handler, answers once and closes (keep-alive is not offered). It lives as a child of its socket.
class HttpConnection : public QObject
{
    Q_OBJECT
public:
    using Handler = std::function<void(HttpConnection *, const HttpRequest &)>;

    HttpConnection(QTcpSocket *socket, const Handler &handler);

    void respond(const HttpResponse &response);
    void respondLater(int milliseconds, const HttpResponse &response);
    void close();
    // Common name of the client certificate; empty on plain HTTP.
    QString clientName() const;

private:
    void readRequest();

    QTcpSocket *m_socket;
    Handler m_handler;
    HttpRequestParser m_parser;
    bool m_answered = false;
};
