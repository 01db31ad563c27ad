#pragma once

#include <QString>

// An address and port whose SYNs go unanswered, as behind a firewall that drops them: a listener
// that never accepts, with its accept queue filled. Needs no privileges; works on loopback.
class Blackhole
{
public:
    Blackhole(const QString &address, quint16 port);
    ~Blackhole() { close(); }
    Blackhole(const Blackhole &) = delete;
    Blackhole &operator=(const Blackhole &) = delete;

    bool isFull() const { return m_full; }
    void close();

private:
    int m_listener = -1;
    int m_fillers[4] = { -1, -1, -1, -1 };
    bool m_full = false;
};
