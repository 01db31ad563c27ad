#include "httprequestparser.h"

#include <QList>

HttpRequestParser::State HttpRequestParser::feed(const QByteArray &bytes)
{
    if (m_state != State::Incomplete)
        return m_state;
    m_buffer += bytes;
    if (!m_headParsed) {
        const int end = m_buffer.indexOf("\r\n\r\n");
        if (end < 0) {
            m_state = m_buffer.size() > maxHeadBytes ? State::TooLarge : State::Incomplete;
            return m_state;
        }
        if (end > maxHeadBytes)
            return m_state = State::TooLarge;
        const QByteArray head = m_buffer.left(end);
        m_buffer.remove(0, end + 4);
        m_headParsed = true;
        m_state = parseHead(head);
        if (m_state != State::Incomplete)
            return m_state;
    }
    return m_state = takeBody();
}

HttpRequestParser::State HttpRequestParser::parseHead(const QByteArray &head)
{
    const QList<QByteArray> lines = head.split('\n');
    const QList<QByteArray> requestLine = lines.first().trimmed().split(' ');
    if (requestLine.size() != 3 || !requestLine.at(2).startsWith("HTTP/1."))
        return State::Invalid;
    m_request.method = requestLine.at(0);
    const QByteArray &target = requestLine.at(1);
    const int query = target.indexOf('?');
    m_request.path = query < 0 ? target : target.left(query);

    for (int i = 1; i < lines.size(); ++i) {
        const QByteArray &line = lines.at(i);
        const int colon = line.indexOf(':');
        if (colon <= 0)
            return State::Invalid;
        m_request.headers.insert(line.left(colon).trimmed().toLower(), line.mid(colon + 1).trimmed());
    }
    // Every client of this server sends a length; chunked bodies are not worth supporting here.
    if (m_request.headers.contains("transfer-encoding"))
        return State::Invalid;
    bool ok = true;
    const QByteArray length = m_request.headers.value("content-length", "0");
    const qlonglong value = length.toLongLong(&ok);
    if (!ok || value < 0)
        return State::Invalid;
    if (value > maxBodyBytes)
        return State::TooLarge;
    m_contentLength = static_cast<int>(value);
    return State::Incomplete;
}

HttpRequestParser::State HttpRequestParser::takeBody()
{
    if (m_buffer.size() < m_contentLength)
        return State::Incomplete;
    m_request.body = m_buffer.left(m_contentLength);
    m_buffer.clear();
    return State::Complete;
}
