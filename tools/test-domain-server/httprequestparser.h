#pragma once

#include "httpmessage.h"

// Incremental parser of one HTTP/1.1 request: request line, headers and a Content-Length body.
// Sizes are capped so that a misbehaving client cannot make the server buffer without bound.
class HttpRequestParser
{
public:
    enum class State { Incomplete, Complete, Invalid, TooLarge };

    static constexpr int maxHeadBytes = 16 * 1024;
    static constexpr int maxBodyBytes = 1024 * 1024;

    State feed(const QByteArray &bytes);
    State state() const { return m_state; }
    const HttpRequest &request() const { return m_request; }

private:
    State parseHead(const QByteArray &head);
    State takeBody();

    QByteArray m_buffer;
    HttpRequest m_request;
    bool m_headParsed = false;
    int m_contentLength = 0;
    State m_state = State::Incomplete;
};
