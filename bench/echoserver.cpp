#include "echoserver.h"

#include <arpa/inet.h>
#include <csignal>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

EchoServer::EchoServer()
{
    const int listener = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof(address);
    if (bind(listener, reinterpret_cast<sockaddr *>(&address), length) != 0 || listen(listener, 64) != 0
        || getsockname(listener, reinterpret_cast<sockaddr *>(&address), &length) != 0) {
        close(listener);
        return;
    }
    m_child = fork();
    if (m_child == 0)
        serve(listener);
    close(listener);
    if (m_child > 0)
        m_port = ntohs(address.sin_port);
}

EchoServer::~EchoServer()
{
    if (m_child <= 0)
        return;
    kill(m_child, SIGKILL);
    waitpid(m_child, nullptr, 0);
}

// One frame in, the same frame out, then the connection ends: what the modules' client does. Runs in
// the forked child: system calls only.
void EchoServer::serve(int listener)
{
    for (;;) {
        const int client = accept(listener, nullptr, nullptr);
        if (client < 0)
            _exit(0);
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
