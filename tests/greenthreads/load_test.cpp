// Loopback load: an echo server with one green thread per connection and
// many concurrent client green threads, all in this one OS thread; every
// byte that comes back is checked.
#include <netinet/tcp.h>
#include <poll.h>

#include <memory>
#include <vector>

#include "nb_test_support.h"
#include "support/test_support.h"

using namespace qorbu::gt;
using namespace qorbu::test;

namespace {

constexpr size_t kMaxMessage = 16 * 1024;

/* Per-client generator: cheap, deterministic, independent of the others. */
struct XorShift {
    uint32_t state;
    uint32_t next()
    {
        state ^= state << 13;
        state ^= state >> 17;
        state ^= state << 5;
        return state;
    }
};

struct EchoServer {
    int listener = -1;
    int expected = 0;
    int accepted = 0;
    int acceptErrors = 0;
    int echoErrors = 0;
    int connectionsDone = 0;
};

struct Connection {
    EchoServer *server;
    int fd;
};

/* Echoed pieces are small and unacknowledged: without this, Nagle's
 * algorithm meets delayed acknowledgements and each message stalls. */
void send_at_once(int fd)
{
    const int on = 1;
    setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
}

void echo_connection(void *arg)
{
    std::unique_ptr<Connection> conn(static_cast<Connection *>(arg));
    std::unique_ptr<unsigned char[]> buffer(new unsigned char[kMaxMessage]);
    set_nonblocking(conn->fd);
    send_at_once(conn->fd);
    for (;;) {
        const int n = nb_read(conn->fd, buffer.get(), kMaxMessage);
        if (n == 0)
            break;
        if (n < 0 || nb_write(conn->fd, buffer.get(), static_cast<size_t>(n)) != n) {
            ++conn->server->echoErrors;
            break;
        }
    }
    close(conn->fd);
    ++conn->server->connectionsDone;
}

void accept_connections(void *arg)
{
    auto *server = static_cast<EchoServer *>(arg);
    while (server->accepted < server->expected) {
        const int fd = nb_accept(server->listener, nullptr, nullptr);
        if (fd < 0) {
            ++server->acceptErrors;
            return;
        }
        ++server->accepted;
        if (greenthread_create(echo_connection, new Connection{server, fd}) == nullptr)
            ++server->echoErrors;
    }
}

struct Client {
    Client(const sockaddr_in *a, int m, uint32_t s) : address(a), messages(m), seed(s) {}
    const sockaddr_in *address;
    int messages;
    uint32_t seed;
    int echoed = 0;       // messages that came back intact
    size_t bytes = 0;     // bytes checked
    int failures = 0;
    std::vector<unsigned char> out, in;
};

void run_client(void *arg)
{
    auto *client = static_cast<Client *>(arg);
    client->out.resize(kMaxMessage);
    client->in.resize(kMaxMessage);
    XorShift random{client->seed};
    const int fd = socket(AF_INET, SOCK_STREAM, 0);
    set_nonblocking(fd);
    send_at_once(fd);
    if (nb_connect(fd, reinterpret_cast<const sockaddr *>(client->address), sizeof *client->address) != 0) {
        ++client->failures;
        close(fd);
        return;
    }
    for (int m = 0; m < client->messages; ++m) {
        const size_t size = 1 + random.next() % kMaxMessage;
        for (size_t i = 0; i < size; ++i)
            client->out[i] = static_cast<unsigned char>(random.next());
        if (nb_write(fd, client->out.data(), size) != static_cast<int>(size) ||
            nb_readall(fd, client->in.data(), size) != static_cast<int>(size)) {
            ++client->failures;
            break;
        }
        if (memcmp(client->out.data(), client->in.data(), size) != 0) {
            ++client->failures;
            break;
        }
        ++client->echoed;
        client->bytes += size;
    }
    close(fd);
}

void run_echo_load(int connections, int messages)
{
    Listener listener(4096);
    ASSERT_GE(listener.fd, 0);
    EchoServer server;
    server.listener = listener.fd;
    server.expected = connections;
    ASSERT_NE(greenthread_create(accept_connections, &server), nullptr);

    std::vector<std::unique_ptr<Client>> clients;
    for (int i = 0; i < connections; ++i) {
        clients.emplace_back(new Client(&listener.addr, messages, 0x9e3779b9u + static_cast<uint32_t>(i) * 7919u));
        ASSERT_NE(greenthread_create(run_client, clients.back().get()), nullptr);
    }
    greenthreads_run();

    EXPECT_EQ(server.accepted, connections);
    EXPECT_EQ(server.acceptErrors, 0);
    EXPECT_EQ(server.echoErrors, 0);
    EXPECT_EQ(server.connectionsDone, connections);
    int failures = 0, incomplete = 0;
    size_t bytes = 0;
    for (const auto &client : clients) {
        failures += client->failures;
        incomplete += client->echoed != messages;
        bytes += client->bytes;
    }
    EXPECT_EQ(failures, 0);
    EXPECT_EQ(incomplete, 0) << "clients that did not get every message back";
    EXPECT_GT(bytes, static_cast<size_t>(connections) * static_cast<size_t>(messages));
    EXPECT_EQ(live_threads, 0);
    EXPECT_EQ(registered_events(listener.fd), 0u);
}

using EchoLoad = GreenIo;

TEST_F(EchoLoad, TwoHundredClientsFiftyMessagesEachInSelectMode)
{
    run_echo_load(scaled(200, 100), scaled(50, 20));
}

TEST_F(EchoLoad, ThousandsOfConnectionsInEpollMode)
{
    const int connections = scaled(3000, 1100); // beyond the 1024 of select either way
    const rlim_t needed = 2 * static_cast<rlim_t>(connections) + 64;
    if (!raise_fd_limit(needed))
        GTEST_SKIP() << "RLIMIT_NOFILE's hard limit is below the " << needed << " descriptors needed";
    ASSERT_EQ(SelUseEpoll(), 0);
    run_echo_load(connections, 3);
    DeInitEpoll();
}

} // namespace
