#include "localconnection.h"

#include <QSocketNotifier>
#include <QTimer>

#include <cerrno>
#include <cstring>

#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

namespace
{
const int receiveChunk = 64 * 1024;

bool wouldBlock(int error)
{
    return error == EAGAIN || error == EWOULDBLOCK || error == EINTR;
}

QString systemError(int error)
{
    return QString::fromLocal8Bit(std::strerror(error));
}

using NameOf = int (*)(int, sockaddr *, socklen_t *);

QHostAddress addressOf(int descriptor, NameOf nameOf, quint16 &port)
{
    sockaddr_storage address {};
    socklen_t length = sizeof(address);
    if (descriptor < 0 || nameOf(descriptor, reinterpret_cast<sockaddr *>(&address), &length) != 0)
        return QHostAddress();
    if (address.ss_family == AF_INET)
        port = ntohs(reinterpret_cast<const sockaddr_in &>(address).sin_port);
    if (address.ss_family == AF_INET6)
        port = ntohs(reinterpret_cast<const sockaddr_in6 &>(address).sin6_port);
    return QHostAddress(reinterpret_cast<const sockaddr *>(&address));
}
} // namespace

LocalConnection::LocalConnection(int descriptor, QObject *parent)
    : QObject(parent)
    , m_descriptor(descriptor)
{
}

LocalConnection::~LocalConnection()
{
    closeDescriptor();
}

QByteArray LocalConnection::read(int length)
{
    const QByteArray bytes = m_input.left(length);
    m_input.remove(0, bytes.size());
    return bytes;
}

void LocalConnection::receive()
{
    if (m_descriptor < 0)
        return;
    char buffer[receiveChunk];
    const ssize_t received = recv(m_descriptor, buffer, sizeof(buffer), MSG_DONTWAIT);
    if (received == 0 || (received < 0 && !wouldBlock(errno))) {
        end(received == 0 ? QStringLiteral("The remote host closed the connection") : systemError(errno));
        return;
    }
    if (received > 0) {
        m_input.append(buffer, int(received));
        Q_EMIT readyRead();
    }
    // Watched only from here on: the first request is answered before the event loop hears of the connection.
    if (m_descriptor >= 0 && !m_readable) {
        m_readable = new QSocketNotifier(m_descriptor, QSocketNotifier::Read, this);
        connect(m_readable, &QSocketNotifier::activated, this, &LocalConnection::receive);
    }
}

void LocalConnection::write(const QByteArray &bytes)
{
    if (m_descriptor < 0)
        return;
    m_output += bytes;
    if (m_output.size() == bytes.size())
        sendPending();
}

void LocalConnection::sendPending()
{
    while (m_descriptor >= 0 && !m_output.isEmpty()) {
        const ssize_t sent
            = send(m_descriptor, m_output.constData(), size_t(m_output.size()), MSG_DONTWAIT | MSG_NOSIGNAL);
        if (sent < 0 && wouldBlock(errno))
            break;
        if (sent < 0) {
            end(systemError(errno));
            return;
        }
        m_output.remove(0, int(sent));
    }
    if (m_descriptor < 0)
        return;
    if (!m_output.isEmpty() && !m_writable) {
        m_writable = new QSocketNotifier(m_descriptor, QSocketNotifier::Write, this);
        connect(m_writable, &QSocketNotifier::activated, this, &LocalConnection::sendPending);
    }
    if (m_writable)
        m_writable->setEnabled(!m_output.isEmpty());
    if (m_output.isEmpty() && m_closeWhenSent)
        end(QString());
}

void LocalConnection::disconnectFromHost()
{
    m_closeWhenSent = true;
    if (m_output.isEmpty())
        end(QString());
}

void LocalConnection::abort()
{
    m_output.clear();
    end(QString());
}

void LocalConnection::end(const QString &reason)
{
    if (m_descriptor < 0)
        return;
    m_error = reason;
    closeDescriptor();
    Q_EMIT disconnected();
}

void LocalConnection::closeDescriptor()
{
    if (m_descriptor < 0)
        return;
    // Notifiers let go of the descriptor before it is closed; they may be on the stack of their own signal.
    if (m_readable)
        m_readable->setEnabled(false);
    if (m_writable)
        m_writable->setEnabled(false);
    if (m_pendingTimer)
        m_pendingTimer->stop();
    close(m_descriptor);
    m_descriptor = -1;
}

bool LocalConnection::peerHasLeft() const
{
    char byte;
    return m_descriptor < 0 || recv(m_descriptor, &byte, 1, MSG_PEEK | MSG_DONTWAIT) == 0;
}

void LocalConnection::watchPendingBytes(int timeoutMs)
{
    if (m_input.isEmpty()) {
        if (m_pendingTimer)
            m_pendingTimer->stop();
        return;
    }
    if (!m_pendingTimer) {
        m_pendingTimer = new QTimer(this);
        m_pendingTimer->setSingleShot(true);
        connect(m_pendingTimer, &QTimer::timeout, this, [this]() {
            if (!m_input.isEmpty())
                abort();
        });
    }
    if (!m_pendingTimer->isActive())
        m_pendingTimer->start(timeoutMs);
}

QHostAddress LocalConnection::peerAddress(quint16 &port) const
{
    return addressOf(m_descriptor, getpeername, port);
}

QHostAddress LocalConnection::localAddress(quint16 &port) const
{
    return addressOf(m_descriptor, getsockname, port);
}
