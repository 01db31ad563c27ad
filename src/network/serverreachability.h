#pragma once

#include <QString>

#include <atomic>
#include <mutex>

// Whether the domain server is known to be out of reach. Shared by the requests of the daemon and
// its update worker: while it is set, requests answer at once instead of waiting on the network,
// and only the worker's probe clears it.
class ServerReachability
{
public:
    // What an administrator is shown; times in seconds since the epoch, 0 for never.
    struct Snapshot {
        bool known = false; // the server was tried at least once
        bool unreachable = false;
        qint64 since = 0; // when the current state began
        qint64 lastContact = 0;
        QString detail; // why it is out of reach
    };

    bool isUnreachable() const { return m_unreachable.load(); }
    // Logs once, when the outage begins.
    void markUnreachable(const QString &hostPort, const QString &detail);
    void markReachable();
    // The server answered.
    void noteContact();
    Snapshot snapshot() const;

private:
    std::atomic<bool> m_unreachable { false };
    mutable std::mutex m_mutex;
    Snapshot m_state;
};
