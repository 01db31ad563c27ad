#include "peeruid.h"

#include <QDebug>

#include <cerrno>
#include <cstring>

#include <linux/inet_diag.h>
#include <linux/netlink.h>
#include <linux/sock_diag.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

namespace
{
struct DiagRequest {
    nlmsghdr header;
    inet_diag_req_v2 body;
};

bool fillAddress(const QHostAddress &address, __be32 *out, quint8 &family)
{
    bool isV4 = false;
    const quint32 v4 = address.toIPv4Address(&isV4);
    if (isV4) {
        family = AF_INET;
        out[0] = htonl(v4);
        return true;
    }
    if (address.protocol() != QAbstractSocket::IPv6Protocol)
        return false;
    family = AF_INET6;
    const Q_IPV6ADDR v6 = address.toIPv6Address();
    std::memcpy(out, v6.c, sizeof(v6.c));
    return true;
}

class NetlinkSocket
{
public:
    NetlinkSocket()
        : m_fd(socket(AF_NETLINK, SOCK_DGRAM | SOCK_CLOEXEC, NETLINK_SOCK_DIAG))
    {
    }
    ~NetlinkSocket()
    {
        if (m_fd >= 0)
            close(m_fd);
    }
    int fd() const { return m_fd; }

private:
    int m_fd;
};

bool answerOf(const char *buffer, ssize_t length, uid_t &uid)
{
    for (auto *header = reinterpret_cast<const nlmsghdr *>(buffer); NLMSG_OK(header, length);
         header = NLMSG_NEXT(header, length)) {
        if (header->nlmsg_type != SOCK_DIAG_BY_FAMILY || header->nlmsg_len < NLMSG_LENGTH(sizeof(inet_diag_msg)))
            return false;
        uid = reinterpret_cast<const inet_diag_msg *>(NLMSG_DATA(header))->idiag_uid;
        return true;
    }
    return false;
}
} // namespace

bool PeerUid::lookup(
    const QHostAddress &peerAddress, quint16 peerPort, const QHostAddress &localAddress, quint16 localPort, uid_t &uid)
{
    DiagRequest request;
    std::memset(&request, 0, sizeof(request));
    quint8 family = 0;
    quint8 localFamily = 0;
    if (!fillAddress(peerAddress, request.body.id.idiag_src, family)
        || !fillAddress(localAddress, request.body.id.idiag_dst, localFamily) || family != localFamily)
        return false;
    request.header.nlmsg_len = sizeof(request);
    request.header.nlmsg_type = SOCK_DIAG_BY_FAMILY;
    request.header.nlmsg_flags = NLM_F_REQUEST;
    request.body.sdiag_family = family;
    request.body.sdiag_protocol = IPPROTO_TCP;
    request.body.idiag_states = ~0U;
    // The peer's own socket: its source is the peer, its destination is this end.
    request.body.id.idiag_sport = htons(peerPort);
    request.body.id.idiag_dport = htons(localPort);
    request.body.id.idiag_cookie[0] = INET_DIAG_NOCOOKIE;
    request.body.id.idiag_cookie[1] = INET_DIAG_NOCOOKIE;

    const NetlinkSocket netlink;
    if (netlink.fd() < 0) {
        qWarning().noquote() << QStringLiteral("cannot open socket diagnostics: ")
                + QString::fromLocal8Bit(strerror(errno));
        return false;
    }
    const timeval timeout { 1, 0 };
    setsockopt(netlink.fd(), SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof(timeout));
    sockaddr_nl kernel;
    std::memset(&kernel, 0, sizeof(kernel));
    kernel.nl_family = AF_NETLINK;
    if (sendto(netlink.fd(), &request, sizeof(request), 0, reinterpret_cast<sockaddr *>(&kernel), sizeof(kernel))
        != ssize_t(sizeof(request)))
        return false;
    alignas(nlmsghdr) char buffer[8192];
    const ssize_t received = recv(netlink.fd(), buffer, sizeof(buffer), 0);
    return received > 0 && answerOf(buffer, received, uid);
}
