#pragma once

#include "httpmessage.h"
#include "httprequestparser.h"

#include <QObject>
#include <QString>

#include <functional>

class QTcpSocket;

// One client connection of the test domain server: reads requests one after the other, hands each
// to the handler and answers it; the connection is kept alive unless the client asks to close it.
// It lives as a child of its socket.
class HttpConnection : public QObject
{
    Q_OBJECT
public:
    using Handler = std::function<void(HttpConnection *, const HttpRequest &)>;

    HttpConnection(QTcpSocket *socket, int serial, const Handler &handler);

    void respond(const HttpResponse &response);
    void respondLater(int milliseconds, const HttpResponse &response);
    void close();
    // Common name of the client certificate; empty on plain HTTP.
    QString clientName() const;
    // Tells the server's connections apart in its request log.
    int serial() const { return m_serial; }

private:
    void readRequest();

    QTcpSocket *m_socket;
    int m_serial;
    Handler m_handler;
    HttpRequestParser m_parser;
    bool m_answered = false;
    bool m_keepAlive = true;
};
