// nb_accept, nb_connect, nb_read, nb_readall and nb_write: retries on
// EAGAIN, end of file, short reads, large writes, refused connections,
// interrupted calls and descriptors the selector refuses.
#include <csignal>
#include <cstdlib>
#include <poll.h>
#include <sys/time.h>

#include <algorithm>
#include <vector>

#include "gt_test_support.h"

using namespace qorbu::gt;
using namespace qorbu::test;

namespace {

using NbCalls = GreenIo;

int ignore_event(int, unsigned, void *, SelFdEntry *) { return 0; }

TEST_F(NbCalls, ReadsWaitReturnShortCountsAndStopAtEndOfFile) {
    SocketPair pair;
    char buf[100] = {};
    int readall = -2, written = -2, shortRead = 0, whole = 0, rest = 0;
    auto shortReader = [&] {
        readall = nb_readall(-1, nullptr, 0);
        written = nb_write(-1, nullptr, 0);
        shortRead = nb_read(pair.fd[0], buf, sizeof buf);
    };
    auto digits = [&] { (void)write(pair.fd[1], "0123456789", 10); };
    run_threads(shortReader, digits);
    EXPECT_EQ(readall, 0) << "a zero-length call made a system call on descriptor -1";
    EXPECT_EQ(written, 0);
    EXPECT_EQ(shortRead, 10);
    EXPECT_EQ(std::string(buf, 10), "0123456789");
    expect_nothing_left(pair.fd[0]);

    auto reader = [&] {
        whole = nb_readall(pair.fd[0], buf, 30);
        rest = nb_readall(pair.fd[0], buf + 30, 70);
    };
    auto chunks = [&] {
        for (char c = 'a'; c <= 'd'; ++c) {
            (void)write(pair.fd[1], std::string(10, c).data(), 10);
            nb_poll(-1, 0, 5); // sleeps, so that the selector wakes the reader between chunks
        }
        pair.close_end(1);
    };
    run_threads(reader, chunks);
    EXPECT_EQ(whole, 30);
    EXPECT_EQ(rest, 10) << "the peer sent 10 of the 70 wanted bytes, then closed";
    EXPECT_EQ(std::string(buf, 40), "aaaaaaaaaabbbbbbbbbbccccccccccdddddddddd");
    expect_nothing_left(pair.fd[0]);

    // A wait would fail on this registration: at end of file no wait is made.
    ASSERT_EQ(SelAddFD(pair.fd[0], SEL_READ, 0, ignore_event, nullptr), 0);
    auto endReader = [&] { shortRead = nb_read(pair.fd[0], buf, sizeof buf); };
    run_threads(endReader);
    EXPECT_EQ(shortRead, 0);
    SelRemFD(pair.fd[0]);
}

TEST_F(NbCalls, WriteLargerThanTheSocketBufferWaitsAndCompletes) {
    SocketPair pair;
    const int small = 4096;
    setsockopt(pair.fd[1], SOL_SOCKET, SO_SNDBUF, &small, sizeof small);
    setsockopt(pair.fd[0], SOL_SOCKET, SO_RCVBUF, &small, sizeof small);
    const size_t total = 1 << 20;
    std::vector<unsigned char> out(total), in(total);
    srand(7);
    std::generate(out.begin(), out.end(), [] { return static_cast<unsigned char>(rand()); });
    int written = 0;
    size_t receivedWhenWriterReturned = 0, received = 0;
    auto writer = [&] {
        written = nb_write(pair.fd[1], out.data(), total);
        receivedWhenWriterReturned = received;
    };
    auto reader = [&] {
        while (received < total) {
            const int n = nb_read(pair.fd[0], in.data() + received, std::min<size_t>(4096, total - received));
            if (n <= 0) break;
            received += static_cast<size_t>(n);
            greenthread_yield();
        }
    };
    run_threads(writer, reader);
    EXPECT_EQ(written, static_cast<int>(total));
    EXPECT_EQ(received, total);
    EXPECT_GT(receivedWhenWriterReturned, 0u) << "the writer never waited for the reader";
    EXPECT_TRUE(in == out);
    expect_nothing_left(pair.fd[0]);
    expect_nothing_left(pair.fd[1]);
}

TEST_F(NbCalls, AcceptAndConnectWaitForEachOtherAndARefusalIsReported) {
    Listener listener, bound(0, false); // bound, never listening: connections are refused
    ASSERT_GE(listener.fd, 0);
    ASSERT_GE(bound.fd, 0);
    const int client = tcp_socket(), refusedClient = tcp_socket();
    int accepted = -2, connected = -2;
    Outcome refused;
    char received = 0;
    auto server = [&] {
        accepted = nb_accept(listener.fd, nullptr, nullptr);
        if (accepted >= 0) {
            set_nonblocking(accepted);
            nb_read(accepted, &received, 1);
        }
    };
    auto connector = [&] {
        connected = nb_connect(client, listener.address(), sizeof listener.addr);
        nb_write(client, "k", 1);
        refused = with_errno(nb_connect(refusedClient, bound.address(), sizeof bound.addr));
    };
    run_threads(server, connector);
    EXPECT_GE(accepted, 0);
    EXPECT_EQ(connected, 0);
    EXPECT_EQ(received, 'k');
    EXPECT_EQ(refused, failure(ECONNREFUSED));
    for (int fd : {listener.fd, client, refusedClient}) expect_nothing_left(fd);
    for (int fd : {client, refusedClient, accepted}) close(fd);
}

// EINTR ends a call at once. The descriptors are left blocking so that the
// system call itself sleeps until a signal interrupts it; should the call
// retry, later signals rescue it so that the test fails instead of hanging.

volatile sig_atomic_t signalsSeen;
int rescueFd = -1;
const sockaddr_in *rescueAddress;

void rescue_after_first_signal(int) {
    signalsSeen = signalsSeen + 1;
    if (signalsSeen < 2) return;
    if (rescueAddress != nullptr) {
        const int fd = socket(AF_INET, SOCK_STREAM, 0);
        (void)connect(fd, reinterpret_cast<const sockaddr *>(rescueAddress), sizeof *rescueAddress);
    } else {
        (void)write(rescueFd, "r", 1);
    }
}

template <typename Call>
void expect_eintr_without_retry(Call call) {
    struct sigaction action = {};
    action.sa_handler = rescue_after_first_signal; // no SA_RESTART: the system call fails with EINTR
    sigaction(SIGALRM, &action, nullptr);
    signalsSeen = 0;
    Outcome outcome;
    auto caller = [&] { outcome = with_errno(call()); };
    itimerval every = {{0, 50000}, {0, 50000}}, off = {};
    setitimer(ITIMER_REAL, &every, nullptr);
    run_threads(caller);
    setitimer(ITIMER_REAL, &off, nullptr);
    EXPECT_EQ(outcome, failure(EINTR));
}

TEST_F(NbCalls, ReadAndAcceptReturnEintrWithoutRetrying) {
    int fds[2];
    ASSERT_EQ(pipe(fds), 0); // blocking
    rescueFd = fds[1];
    rescueAddress = nullptr;
    char byte;
    expect_eintr_without_retry([&] { return nb_read(fds[0], &byte, 1); });
    close(fds[0]);
    close(fds[1]);

    Listener listener;
    ASSERT_GE(listener.fd, 0);
    fcntl(listener.fd, F_SETFL, fcntl(listener.fd, F_GETFL) & ~O_NONBLOCK);
    rescueAddress = &listener.addr;
    expect_eintr_without_retry([&] { return nb_accept(listener.fd, nullptr, nullptr); });
}

// A descriptor the selector refuses makes every call fail with the
// registration's errno instead of retrying for ever.
TEST_F(NbCalls, RefusedRegistrationEndsEveryCallWithItsErrno) {
    SocketPair empty, full;
    Listener listener;
    ASSERT_GE(listener.fd, 0);
    const int client = tcp_socket();
    std::vector<char> filler(64 * 1024, 'f');
    while (write(full.fd[1], filler.data(), filler.size()) > 0) { // a write would now block
    }
    const int fds[] = {empty.fd[0], full.fd[1], listener.fd, client};
    for (int fd : fds) ASSERT_EQ(SelAddFD(fd, SEL_EXCEPT, 0, ignore_event, nullptr), 0);

    Outcome reading, readingAll, writing, accepting, connecting;
    char buf[8];
    auto caller = [&] {
        reading = with_errno(nb_read(empty.fd[0], buf, sizeof buf));
        readingAll = with_errno(nb_readall(empty.fd[0], buf, sizeof buf));
        writing = with_errno(nb_write(full.fd[1], filler.data(), filler.size()));
        accepting = with_errno(nb_accept(listener.fd, nullptr, nullptr));
        connecting = with_errno(nb_connect(client, listener.address(), sizeof listener.addr));
    };
    run_threads(caller);
    for (const Outcome &o : {reading, readingAll, writing, accepting}) EXPECT_EQ(o, failure(EBUSY));
    if (connecting.first != 0) { // a loopback connection may be established at once, without a wait
        EXPECT_EQ(connecting, failure(EBUSY));
    }
    for (int fd : fds) {
        EXPECT_EQ(registered_events(fd), SEL_EXCEPT) << "the other registration of " << fd << " was lost";
        SelRemFD(fd);
    }
    close(client);
}

} // namespace
