#pragma once

#include "cachedaemonfixture.h"

#include <QElapsedTimer>
#include <QTcpSocket>
#include <QtEndian>

// A raw connection to the daemon for framing tests: bytes go out exactly as given.
class RawConnection
{
public:
    explicit RawConnection(quint16 port)
    {
        m_socket.connectToHost(QStringLiteral("127.0.0.1"), port);
        m_socket.waitForConnected(5000);
    }

    bool isConnected() const { return m_socket.state() == QAbstractSocket::ConnectedState; }

    void send(const QByteArray &bytes)
    {
        m_socket.write(bytes);
        m_socket.flush();
        m_socket.waitForBytesWritten(1000);
    }

    // The next reply payload; null when none arrives within the time.
    QByteArray reply(int timeoutMs = 20000)
    {
        QElapsedTimer timer;
        timer.start();
        for (;;) {
            m_buffer += m_socket.readAll();
            if (m_buffer.size() >= 4) {
                const quint32 length = qFromBigEndian<quint32>(m_buffer.constData());
                if (quint32(m_buffer.size()) >= length + 4) {
                    const QByteArray payload = m_buffer.mid(4, int(length));
                    m_buffer.remove(0, int(length) + 4);
                    return payload;
                }
            }
            const qint64 left = timeoutMs - timer.elapsed();
            if (left <= 0 || (!m_socket.waitForReadyRead(int(left)) && !isConnected()))
                return QByteArray();
        }
    }

    // True when the peer closed the connection within the time.
    bool closedWithin(int timeoutMs)
    {
        if (!isConnected())
            return true;
        m_socket.waitForDisconnected(timeoutMs);
        return !isConnected();
    }

    void abort() { m_socket.abort(); }

private:
    QTcpSocket m_socket;
    QByteArray m_buffer;
};
