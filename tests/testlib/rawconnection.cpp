#include "rawconnection.h"

#include <QDeadlineTimer>
#include <QtEndian>

RawConnection::RawConnection(quint16 port)
{
    m_socket.connectToHost(QStringLiteral("127.0.0.1"), port);
    m_socket.waitForConnected(5000);
}

void RawConnection::send(const QByteArray &bytes)
{
    m_socket.write(bytes);
    m_socket.waitForBytesWritten(1000);
}

QByteArray RawConnection::reply(int timeoutMs)
{
    const QDeadlineTimer deadline(timeoutMs);
    const auto length = [this] { return m_buffer.size() < 4 ? -1 : int(qFromBigEndian<quint32>(m_buffer.data())); };
    for (m_buffer += m_socket.readAll(); length() < 0 || m_buffer.size() < length() + 4;
         m_buffer += m_socket.readAll()) {
        if (deadline.hasExpired() || (!m_socket.waitForReadyRead(int(deadline.remainingTime())) && !isConnected()))
            return QByteArray();
    }
    const QByteArray payload = m_buffer.mid(4, length());
    m_buffer.remove(0, length() + 4);
    return payload;
}
