// Loopback load: an echo server with one green thread per connection and
// many concurrent client green threads, all in this one OS thread; every
// byte that comes back is checked.
#include <netinet/tcp.h>

#include <memory>
#include <vector>

#include "gt_test_support.h"

using namespace qorbu::gt;
using namespace qorbu::test;

namespace {

constexpr size_t kMaxMessage = 16 * 1024; // buffers live on the heap: stacks are 16 KiB too

struct EchoServer {
    int listener, expected, accepted = 0, acceptErrors = 0, echoErrors = 0, connectionsDone = 0;
};

struct Connection {
    EchoServer *server;
    int fd;
};

/* Echoed pieces are small and unacknowledged: without this, Nagle's
 * algorithm meets delayed acknowledgements and each message stalls. */
void send_at_once(int fd) {
    const int on = 1;
    setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
}

void echo_connection(void *arg) {
    std::unique_ptr<Connection> conn(static_cast<Connection *>(arg));
    std::vector<unsigned char> buffer(kMaxMessage);
    set_nonblocking(conn->fd);
    send_at_once(conn->fd);
    for (int n; (n = nb_read(conn->fd, buffer.data(), kMaxMessage)) != 0;) {
        if (n < 0 || nb_write(conn->fd, buffer.data(), static_cast<size_t>(n)) != n) {
            ++conn->server->echoErrors;
            break;
        }
    }
    close(conn->fd);
    ++conn->server->connectionsDone;
}

void accept_connections(void *arg) {
    auto *server = static_cast<EchoServer *>(arg);
    while (server->accepted < server->expected) {
        const int fd = nb_accept(server->listener, nullptr, nullptr);
        if (fd < 0) {
            ++server->acceptErrors;
            return;
        }
        ++server->accepted;
        if (greenthread_create(echo_connection, new Connection{server, fd}) == nullptr) ++server->echoErrors;
    }
}

struct Client {
    const sockaddr_in *address;
    int messages;
    uint32_t random; // xorshift state: deterministic, independent of the other clients
    int echoed = 0;  // messages that came back intact
    size_t bytes = 0;
    bool failed = false;
    uint32_t next() {
        random ^= random << 13;
        random ^= random >> 17;
        random ^= random << 5;
        return random;
    }
};

void run_client(void *arg) {
    auto *client = static_cast<Client *>(arg);
    std::vector<unsigned char> out(kMaxMessage), in(kMaxMessage);
    const int fd = tcp_socket();
    send_at_once(fd);
    client->failed =
        nb_connect(fd, reinterpret_cast<const sockaddr *>(client->address), sizeof *client->address) != 0;
    for (int m = 0; m < client->messages && !client->failed; ++m) {
        const size_t size = 1 + client->next() % kMaxMessage;
        for (size_t i = 0; i < size; ++i) out[i] = static_cast<unsigned char>(client->next());
        client->failed = nb_write(fd, out.data(), size) != static_cast<int>(size) ||
                         nb_readall(fd, in.data(), size) != static_cast<int>(size) ||
                         memcmp(out.data(), in.data(), size) != 0;
        if (!client->failed) {
            ++client->echoed;
            client->bytes += size;
        }
    }
    close(fd);
}

void run_echo_load(int connections, int messages) {
    Listener listener(4096);
    ASSERT_GE(listener.fd, 0);
    EchoServer server{listener.fd, connections};
    ASSERT_NE(greenthread_create(accept_connections, &server), nullptr);
    std::vector<Client> clients;
    clients.reserve(static_cast<size_t>(connections));
    for (int i = 0; i < connections; ++i) {
        clients.push_back(Client{&listener.addr, messages, 0x9e3779b9u + static_cast<uint32_t>(i) * 7919u});
        ASSERT_NE(greenthread_create(run_client, &clients.back()), nullptr);
    }
    greenthreads_run();

    EXPECT_EQ(server.accepted, connections);
    EXPECT_EQ(server.acceptErrors, 0);
    EXPECT_EQ(server.echoErrors, 0);
    EXPECT_EQ(server.connectionsDone, connections);
    int failures = 0, incomplete = 0;
    size_t bytes = 0;
    for (const Client &client : clients) {
        failures += client.failed;
        incomplete += client.echoed != messages;
        bytes += client.bytes;
    }
    EXPECT_EQ(failures, 0);
    EXPECT_EQ(incomplete, 0) << "clients that did not get every message back";
    EXPECT_GT(bytes, static_cast<size_t>(connections) * static_cast<size_t>(messages));
    EXPECT_EQ(live_threads, 0);
    EXPECT_EQ(registered_events(listener.fd), 0u);
}

using EchoLoad = GreenIo;

TEST_F(EchoLoad, TwoHundredClientsFiftyMessagesEachInSelectMode) {
    run_echo_load(scaled(200, 100), scaled(50, 20));
}

TEST_F(EchoLoad, ThousandsOfConnectionsInEpollMode) {
    const int connections = scaled(3000, 1100); // beyond the 1024 of select either way
    const rlim_t needed = 2 * static_cast<rlim_t>(connections) + 64;
    if (!raise_fd_limit(needed))
        GTEST_SKIP() << "RLIMIT_NOFILE's hard limit is below the " << needed << " descriptors needed";
    ASSERT_EQ(SelUseEpoll(), 0);
    run_echo_load(connections, 3);
    DeInitEpoll();
}

} // namespace
