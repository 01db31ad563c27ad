#include "rawconnection.h"

#include <QDeadlineTimer>
#include <QtEndian>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

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

int RawConnection::exchange(quint16 port, const QByteArray &frame, char *reply, int capacity)
{
    const int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address {};
    address.sin_family = AF_INET;
    address.sin_port = htons(port);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    const timeval timeout { 20, 0 };
    setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof(timeout));
    int have = 0;
    bool ok = connect(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) == 0
        && ::send(fd, frame.constData(), size_t(frame.size()), 0) == frame.size();
    while (ok && (have < 4 || have < 4 + int(qFromBigEndian<quint32>(reply)))) {
        const ssize_t got = recv(fd, reply + have, size_t(capacity - have), 0);
        ok = got > 0;
        have += ok ? int(got) : 0;
    }
    ::close(fd);
    return ok ? have : -1;
}
