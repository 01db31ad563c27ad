#pragma once

#include <cstdint>
#include <thread>

// A trivial framed echo server on 127.0.0.1, on a thread of its own: the floor of a local round trip.
class EchoServer
{
public:
    EchoServer();
    ~EchoServer();
    uint16_t port() const { return m_port; }

private:
    void serve();

    int m_listener = -1;
    uint16_t m_port = 0;
    std::thread m_thread;
};
