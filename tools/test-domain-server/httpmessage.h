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
    int status = 200;
    QByteArray body;
};
