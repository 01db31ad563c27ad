#pragma once

#include <QHostAddress>

#include <sys/types.h>

// The owner of the other end of a local TCP connection, as the kernel's socket diagnostics report it
// (inet_diag over NETLINK_SOCK_DIAG). Works for peers on this machine only: that is the point.
class PeerUid
{
public:
    // False when the kernel knows no such socket or cannot be asked.
    static bool lookup(const QHostAddress &peerAddress, quint16 peerPort, const QHostAddress &localAddress,
        quint16 localPort, uid_t &uid);
};
