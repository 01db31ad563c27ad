#pragma once

#include <QByteArray>
#include <QList>

#include <thread>

// A stand-in peer on 127.0.0.1: answers one connection per given answer, in order, from a thread of
// its own, and keeps each request as it came. Nothing answers once the answers are used up.
class LoopbackPeer
{
public:
    explicit LoopbackPeer(const QList<QByteArray> &answers);
    ~LoopbackPeer() { finish(); }
    LoopbackPeer(const LoopbackPeer &) = delete;
    LoopbackPeer &operator=(const LoopbackPeer &) = delete;

    quint16 port() const { return m_port; }
    // Stops listening (the port refuses from now on) and returns what was asked.
    QList<QByteArray> finish();

private:
    int m_fd;
    quint16 m_port = 0;
    QList<QByteArray> m_requests;
    std::thread m_thread;
};
