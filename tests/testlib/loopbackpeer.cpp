#include "loopbackpeer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

LoopbackPeer::LoopbackPeer(const QList<QByteArray> &answers)
    : m_fd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0))
{
    sockaddr_in address {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof(address);
    bind(m_fd, reinterpret_cast<sockaddr *>(&address), length);
    listen(m_fd, 4);
    getsockname(m_fd, reinterpret_cast<sockaddr *>(&address), &length);
    m_port = ntohs(address.sin_port);
    m_thread = std::thread([this, answers]() {
        for (const QByteArray &answer : answers) {
            const int connection = accept(m_fd, nullptr, nullptr);
            if (connection < 0)
                return;
            char buffer[4096];
            m_requests.append(QByteArray(buffer, int(qMax<ssize_t>(recv(connection, buffer, sizeof(buffer), 0), 0))));
            send(connection, answer.constData(), size_t(answer.size()), MSG_NOSIGNAL);
            close(connection);
        }
    });
}

QList<QByteArray> LoopbackPeer::finish()
{
    if (m_fd < 0)
        return m_requests;
    shutdown(m_fd, SHUT_RDWR);
    if (m_thread.joinable())
        m_thread.join();
    close(m_fd);
    m_fd = -1;
    return m_requests;
}
