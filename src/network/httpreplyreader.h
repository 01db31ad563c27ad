#pragma once

#include <QByteArray>

// Incremental reader of one HTTP/1.1 response: status line, headers, and a body framed by
// Content-Length, chunked transfer coding or the end of the connection. Every size is capped, so a
// server cannot make the client buffer without bound.
class HttpReplyReader
{
public:
    enum class State { Incomplete, Complete, Invalid, TooLarge };

    static const int maximumHeadBytes = 64 * 1024;

    explicit HttpReplyReader(int maximumBodyBytes = 16 * 1024 * 1024);

    State feed(const QByteArray &bytes);
    // The peer closed the connection: a body that runs to the end of the connection is complete now.
    State finish();
    State state() const { return m_state; }

    int status() const { return m_status; }
    const QByteArray &body() const { return m_body; }
    // Whether the connection may carry the next request.
    bool keepAlive() const { return m_keepAlive; }

private:
    enum class Framing { Length, Chunked, UntilClose };

    State parse();
    bool parseHead(const QByteArray &head);
    bool parseHeader(const QByteArray &line);
    State takeLengthBody();
    State takeChunks();

    const int m_maximumBodyBytes;
    QByteArray m_buffer;
    QByteArray m_body;
    State m_state = State::Incomplete;
    bool m_headDone = false;
    int m_status = 0;
    bool m_keepAlive = true;
    Framing m_framing = Framing::UntilClose;
    qint64 m_length = 0;
    qint64 m_chunkLeft = -1; // -1: a chunk-size line comes next
    bool m_trailers = false;
};
