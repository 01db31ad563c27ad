#include "blackhole.h"

#include <QHostAddress>

#include <arpa/inet.h>
#include <cerrno>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

namespace
{
sockaddr_in socketAddress(const QString &address, quint16 port)
{
    sockaddr_in result {};
    result.sin_family = AF_INET;
    result.sin_port = htons(port);
    result.sin_addr.s_addr = htonl(QHostAddress(address).toIPv4Address());
    return result;
}

// A connection attempt that the kernel completes on its own: true once it stands in the queue.
bool queued(int fd, const sockaddr_in &target)
{
    fcntl(fd, F_SETFL, O_NONBLOCK);
    if (connect(fd, reinterpret_cast<const sockaddr *>(&target), sizeof(target)) == 0)
        return true;
    if (errno != EINPROGRESS)
        return false;
    pollfd wait { fd, POLLOUT, 0 };
    return poll(&wait, 1, 200) == 1;
}
} // namespace

Blackhole::Blackhole(const QString &address, quint16 port)
{
    const sockaddr_in target = socketAddress(address, port);
    m_listener = socket(AF_INET, SOCK_STREAM, 0);
    const int yes = 1;
    setsockopt(m_listener, SOL_SOCKET, SO_REUSEADDR, &yes, sizeof(yes));
    if (bind(m_listener, reinterpret_cast<const sockaddr *>(&target), sizeof(target)) != 0
        || listen(m_listener, 0) != 0)
        return;
    // A backlog of 0 holds one finished connection; the attempt that no longer completes proves it full.
    for (int &filler : m_fillers) {
        filler = socket(AF_INET, SOCK_STREAM, 0);
        if (!queued(filler, target)) {
            m_full = true;
            return;
        }
    }
}

void Blackhole::close()
{
    for (int &filler : m_fillers) {
        if (filler >= 0)
            ::close(filler);
        filler = -1;
    }
    if (m_listener >= 0)
        ::close(m_listener);
    m_listener = -1;
}
