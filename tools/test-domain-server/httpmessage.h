#pragma once

#include <QByteArray>
#include <QMap>

// One HTTP request as the test domain server received it. Header names are lower-cased.
struct HttpRequest {
    QByteArray method;
    QByteArray path;
    QMap<QByteArray, QByteArray> headers;
    QByteArray body;
};

struct HttpResponse {
    HttpResponse(int status = 200, const QByteArray &body = QByteArray(),
                 const QMap<QByteArray, QByteArray> &headers = QMap<QByteArray, QByteArray>())
        : status(status)
        , body(body)
        , headers(headers)
    {
    }

    int status;
    QByteArray body;
    QMap<QByteArray, QByteArray> headers; // besides Content-Type, Content-Length and Connection
};
