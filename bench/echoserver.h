#pragma once

#include <cstdint>
#include <sys/types.h>

// A trivial framed echo server on 127.0.0.1 in a process of its own, as cache-kest is: the floor of a
// local round trip to another process.
class EchoServer
{
public:
    EchoServer();
    ~EchoServer();
    EchoServer(const EchoServer &) = delete;
    EchoServer &operator=(const EchoServer &) = delete;
    uint16_t port() const { return m_port; }

private:
    static void serve(int listener);

    uint16_t m_port = 0;
    pid_t m_child = -1;
};
