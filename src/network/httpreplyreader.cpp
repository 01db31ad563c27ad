#include "httpreplyreader.h"

#include <QList>

namespace
{
const QByteArray lineEnd("\r\n");
const QByteArray headEnd("\r\n\r\n");

bool parseDecimal(const QByteArray &text, qint64 &value)
{
    if (text.isEmpty() || text.size() > 15)
        return false;
    for (const char c : text) {
        if (c < '0' || c > '9')
            return false;
    }
    value = text.toLongLong();
    return true;
}
} // namespace

HttpReplyReader::HttpReplyReader(int maximumBodyBytes)
    : m_maximumBodyBytes(maximumBodyBytes)
{
}

HttpReplyReader::State HttpReplyReader::feed(const QByteArray &bytes)
{
    if (m_state != State::Incomplete)
        return m_state;
    m_buffer += bytes;
    m_state = parse();
    return m_state;
}

HttpReplyReader::State HttpReplyReader::finish()
{
    if (m_state != State::Incomplete)
        return m_state;
    if (m_headDone && m_framing == Framing::UntilClose) {
        m_keepAlive = false;
        m_state = State::Complete;
    } else {
        m_state = State::Invalid;
    }
    return m_state;
}

HttpReplyReader::State HttpReplyReader::parse()
{
    while (!m_headDone) {
        const int end = m_buffer.indexOf(headEnd);
        if (end < 0)
            return m_buffer.size() > maximumHeadBytes ? State::TooLarge : State::Incomplete;
        if (end > maximumHeadBytes)
            return State::TooLarge;
        const QByteArray head = m_buffer.left(end);
        m_buffer.remove(0, end + headEnd.size());
        if (!parseHead(head))
            return State::Invalid;
        // An interim answer (100 Continue) is followed by the real one.
        if (m_status >= 200)
            m_headDone = true;
    }
    switch (m_framing) {
    case Framing::Length:
        return takeLengthBody();
    case Framing::Chunked:
        return takeChunks();
    case Framing::UntilClose:
        break;
    }
    m_body += m_buffer;
    m_buffer.clear();
    return m_body.size() > m_maximumBodyBytes ? State::TooLarge : State::Incomplete;
}

bool HttpReplyReader::parseHead(const QByteArray &head)
{
    const QList<QByteArray> lines = head.split('\n');
    const QList<QByteArray> statusLine = lines.first().trimmed().split(' ');
    if (statusLine.size() < 2 || !statusLine.at(0).startsWith("HTTP/1."))
        return false;
    qint64 status = 0;
    if (!parseDecimal(statusLine.at(1), status) || status < 100 || status > 999)
        return false;
    m_status = int(status);
    m_keepAlive = statusLine.at(0) != "HTTP/1.0";
    m_framing = Framing::UntilClose;
    for (int i = 1; i < lines.size(); ++i) {
        if (!parseHeader(lines.at(i)))
            return false;
    }
    if (m_status == 204 || m_status == 304) {
        m_framing = Framing::Length;
        m_length = 0;
    }
    return true;
}

bool HttpReplyReader::parseHeader(const QByteArray &line)
{
    const int colon = line.indexOf(':');
    if (colon <= 0)
        return false;
    const QByteArray name = line.left(colon).trimmed().toLower();
    const QByteArray value = line.mid(colon + 1).trimmed().toLower();
    if (name == "content-length" && m_framing != Framing::Chunked) {
        qint64 length = 0;
        if (!parseDecimal(value, length) || (m_framing == Framing::Length && length != m_length))
            return false;
        m_framing = Framing::Length;
        m_length = length;
    } else if (name == "transfer-encoding") {
        if (!value.endsWith("chunked"))
            return false;
        m_framing = Framing::Chunked;
    } else if (name == "connection") {
        if (value.contains("close"))
            m_keepAlive = false;
        else if (value.contains("keep-alive"))
            m_keepAlive = true;
    }
    return true;
}

HttpReplyReader::State HttpReplyReader::takeLengthBody()
{
    if (m_length > m_maximumBodyBytes)
        return State::TooLarge;
    if (m_buffer.size() < m_length)
        return State::Incomplete;
    m_body = m_buffer.left(int(m_length));
    // Bytes past the answer mean the connection is out of step with its requests.
    if (m_buffer.size() > m_length)
        m_keepAlive = false;
    m_buffer.clear();
    return State::Complete;
}

HttpReplyReader::State HttpReplyReader::takeChunks()
{
    for (;;) {
        if (m_trailers) {
            const int end = m_buffer.indexOf(lineEnd);
            if (end < 0)
                return m_buffer.size() > maximumHeadBytes ? State::TooLarge : State::Incomplete;
            m_buffer.remove(0, end + lineEnd.size());
            if (end != 0)
                continue;
            // As after a sized body: bytes past the answer put the connection out of step.
            m_keepAlive = m_keepAlive && m_buffer.isEmpty();
            return State::Complete;
        }
        if (m_chunkLeft < 0) {
            const int end = m_buffer.indexOf(lineEnd);
            if (end < 0)
                return m_buffer.size() > 1024 ? State::Invalid : State::Incomplete;
            QByteArray size = m_buffer.left(end);
            const int extension = size.indexOf(';');
            if (extension >= 0)
                size.truncate(extension);
            bool ok = false;
            const qint64 length = size.trimmed().toLongLong(&ok, 16);
            if (!ok || length < 0 || size.trimmed().size() > 8)
                return State::Invalid;
            m_buffer.remove(0, end + lineEnd.size());
            if (length == 0) {
                m_trailers = true;
                continue;
            }
            if (m_body.size() + length > m_maximumBodyBytes)
                return State::TooLarge;
            m_chunkLeft = length;
        }
        if (m_buffer.size() < m_chunkLeft + lineEnd.size())
            return State::Incomplete;
        if (m_buffer.mid(int(m_chunkLeft), lineEnd.size()) != lineEnd)
            return State::Invalid;
        m_body += m_buffer.left(int(m_chunkLeft));
        m_buffer.remove(0, int(m_chunkLeft) + lineEnd.size());
        m_chunkLeft = -1;
    }
}
