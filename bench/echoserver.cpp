#include "echoserver.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

EchoServer::EchoServer()
{
    m_listener = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof(address);
    if (bind(m_listener, reinterpret_cast<sockaddr *>(&address), length) != 0 || listen(m_listener, 64) != 0)
        return;
    getsockname(m_listener, reinterpret_cast<sockaddr *>(&address), &length);
    m_port = ntohs(address.sin_port);
    m_thread = std::thread(&EchoServer::serve, this);
}

EchoServer::~EchoServer()
{
    shutdown(m_listener, SHUT_RDWR);
    close(m_listener);
    if (m_thread.joinable())
        m_thread.join();
}

// One frame in, the same frame out, then the connection ends: what the modules' client does.
void EchoServer::serve()
{
    for (;;) {
        const int client = accept(m_listener, nullptr, nullptr);
        if (client < 0)
            return;
        char buffer[65536];
        ssize_t have = 0;
        for (;;) {
            const ssize_t got = recv(client, buffer + have, sizeof(buffer) - size_t(have), 0);
            if (got <= 0)
                break;
            have += got;
            if (have >= 4 && have >= 4 + ssize_t(ntohl(*reinterpret_cast<uint32_t *>(buffer))))
                break;
        }
        if (have > 0)
            send(client, buffer, size_t(have), 0);
        close(client);
    }
}
