#pragma once

#include <QString>

#include <atomic>

// Whether the domain server is known to be out of reach. Shared by the requests of the daemon and
// its update worker: while it is set, requests answer at once instead of waiting on the network,
// and only the worker's probe clears it.
class ServerReachability
{
public:
    bool isUnreachable() const { return m_unreachable.load(); }
    // Logs once, when the outage begins.
    void markUnreachable(const QString &hostPort, const QString &detail);
    void markReachable() { m_unreachable.store(false); }

private:
    std::atomic<bool> m_unreachable { false };
};
