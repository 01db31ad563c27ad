#pragma once

#include <QByteArray>
#include <QTcpSocket>

// A TCP connection to the cache daemon on 127.0.0.1 that sends bytes exactly as given and reads
// length-prefixed reply frames.
class RawConnection
{
public:
    explicit RawConnection(quint16 port);

    bool isConnected() const { return m_socket.state() == QAbstractSocket::ConnectedState; }
    void send(const QByteArray &bytes);
    // The next reply's payload; null when none arrives in time.
    QByteArray reply(int timeoutMs = 20000);
    // True when the peer closed the connection in time.
    bool closedWithin(int timeoutMs) { return !isConnected() || m_socket.waitForDisconnected(timeoutMs); }
    void abort() { m_socket.abort(); }

    // What the modules' client does, in system calls only (safe in a forked child): connect, send one
    // frame, read one whole reply frame, close. The reply frame's length, or -1.
    static int exchange(quint16 port, const QByteArray &frame, char *reply, int capacity);

private:
    QTcpSocket m_socket;
    QByteArray m_buffer;
};
