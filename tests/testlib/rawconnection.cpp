#include "rawconnection.h"

#include <QElapsedTimer>
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
    QElapsedTimer timer;
    timer.start();
    for (;;) {
        m_buffer += m_socket.readAll();
        const quint32 length = m_buffer.size() >= 4 ? qFromBigEndian<quint32>(m_buffer.constData()) : 0;
        if (m_buffer.size() >= 4 && quint32(m_buffer.size()) >= length + 4) {
            const QByteArray payload = m_buffer.mid(4, int(length));
            m_buffer.remove(0, int(length) + 4);
            return payload;
        }
        const qint64 left = timeoutMs - timer.elapsed();
        if (left <= 0 || (!m_socket.waitForReadyRead(int(left)) && !isConnected()))
            return QByteArray();
    }
}

bool RawConnection::closedWithin(int timeoutMs)
{
    if (isConnected())
        m_socket.waitForDisconnected(timeoutMs);
    return !isConnected();
}
