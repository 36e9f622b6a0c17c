// nb_accept, nb_connect, nb_read, nb_readall and nb_write: retries on
// EAGAIN, end of file, short reads, large writes, refused connections,
// interrupted calls and descriptors the selector refuses.
#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/time.h>

#include <algorithm>
#include <vector>

#include "nb_test_support.h"

using namespace qorbu::gt;
using namespace qorbu::test;

namespace {

using NbCalls = GreenIo;

int ignore_event(int, unsigned, void *, SelFdEntry *) { return 0; }

TEST_F(NbCalls, ReadAtEndOfFileReturnsZeroWithoutWaiting)
{
    SocketPair pair;
    pair.close_end(1);
    // A wait would fail on this registration: the call must not wait.
    ASSERT_EQ(SelAddFD(pair.fd[0], SEL_READ, 0, ignore_event, nullptr), 0);
    int result = -2;
    char buf[16];
    auto reader = [&] { result = nb_read(pair.fd[0], buf, sizeof buf); };
    spawn(&reader);
    greenthreads_run();
    EXPECT_EQ(result, 0);
    SelRemFD(pair.fd[0]);
}

TEST_F(NbCalls, ReadWaitsForDataAndReturnsAShortCount)
{
    SocketPair pair;
    int result = 0;
    bool writerRan = false;
    char buf[100] = {};
    auto reader = [&] { result = nb_read(pair.fd[0], buf, sizeof buf); };
    auto writer = [&] {
        writerRan = true;
        (void)write(pair.fd[1], "0123456789", 10);
    };
    spawn(&reader);
    spawn(&writer);
    greenthreads_run();
    EXPECT_TRUE(writerRan);
    EXPECT_EQ(result, 10);
    EXPECT_EQ(memcmp(buf, "0123456789", 10), 0);
    expect_nothing_left(pair.fd[0]);
}

TEST_F(NbCalls, ReadallGathersSeveralWritesAndStopsAtEndOfFile)
{
    SocketPair pair;
    std::vector<char> buf(100, 0);
    int whole = 0, shortRead = 0;
    auto reader = [&] {
        whole = nb_readall(pair.fd[0], buf.data(), 30);
        shortRead = nb_readall(pair.fd[0], buf.data() + 30, 70);
    };
    auto writer = [&] {
        for (int chunk = 0; chunk < 4; ++chunk) {
            char bytes[10];
            memset(bytes, 'a' + chunk, sizeof bytes);
            (void)write(pair.fd[1], bytes, sizeof bytes);
            sleep_ms(5); // lets the selector wake the reader between chunks
        }
        pair.close_end(1);
    };
    spawn(&reader);
    spawn(&writer);
    greenthreads_run();
    EXPECT_EQ(whole, 30);
    EXPECT_EQ(shortRead, 10) << "the peer sent 10 of the 70 wanted bytes, then closed";
    EXPECT_EQ(std::string(buf.data(), 40), std::string(10, 'a') + std::string(10, 'b') + std::string(10, 'c') +
                                              std::string(10, 'd'));
    expect_nothing_left(pair.fd[0]);
}

TEST_F(NbCalls, ZeroLengthReadallAndWriteMakeNoSystemCall)
{
    int readall = -2, written = -2;
    auto caller = [&] {
        readall = nb_readall(-1, nullptr, 0);
        written = nb_write(-1, nullptr, 0);
    };
    spawn(&caller);
    greenthreads_run();
    EXPECT_EQ(readall, 0) << "a read on descriptor -1 would have failed";
    EXPECT_EQ(written, 0);
}

TEST_F(NbCalls, WriteLargerThanTheSocketBufferWaitsAndCompletes)
{
    SocketPair pair;
    const int small = 4096;
    setsockopt(pair.fd[1], SOL_SOCKET, SO_SNDBUF, &small, sizeof small);
    setsockopt(pair.fd[0], SOL_SOCKET, SO_RCVBUF, &small, sizeof small);
    const size_t total = 1 << 20;
    std::vector<unsigned char> out(total), in(total);
    srand(7);
    for (auto &byte : out)
        byte = static_cast<unsigned char>(rand());
    int written = 0;
    size_t receivedWhenWriterReturned = 0, received = 0;
    auto writer = [&] {
        written = nb_write(pair.fd[1], out.data(), total);
        receivedWhenWriterReturned = received;
    };
    auto reader = [&] {
        while (received < total) {
            const int n = nb_read(pair.fd[0], in.data() + received, std::min<size_t>(4096, total - received));
            if (n <= 0)
                break;
            received += static_cast<size_t>(n);
            greenthread_yield();
        }
    };
    spawn(&writer);
    spawn(&reader);
    greenthreads_run();
    EXPECT_EQ(written, static_cast<int>(total));
    EXPECT_EQ(received, total);
    EXPECT_GT(receivedWhenWriterReturned, 0u) << "the writer never waited for the reader";
    EXPECT_TRUE(in == out);
    expect_nothing_left(pair.fd[0]);
    expect_nothing_left(pair.fd[1]);
}

TEST_F(NbCalls, AcceptWaitsForAConnectionThatConnectCompletes)
{
    Listener listener;
    ASSERT_GE(listener.fd, 0);
    const int client = tcp_socket();
    int accepted = -2, connected = -2;
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
    };
    spawn(&server);
    spawn(&connector);
    greenthreads_run();
    EXPECT_GE(accepted, 0);
    EXPECT_EQ(connected, 0);
    EXPECT_EQ(received, 'k');
    expect_nothing_left(listener.fd);
    expect_nothing_left(client);
    close(client);
    if (accepted >= 0)
        close(accepted);
}

TEST_F(NbCalls, ConnectionRefusedIsReportedOnceTheAttemptCompletes)
{
    Listener bound(0, false); // bound, never listening: connections are refused
    ASSERT_GE(bound.fd, 0);
    const int client = tcp_socket();
    int result = 0, error = 0;
    auto connector = [&] {
        result = nb_connect(client, bound.address(), sizeof bound.addr);
        error = errno;
    };
    spawn(&connector);
    greenthreads_run();
    EXPECT_EQ(result, -1);
    EXPECT_EQ(error, ECONNREFUSED);
    expect_nothing_left(client);
    close(client);
}

// ---------------------------------------------------------------------------
// EINTR ends a call at once. The descriptors are left blocking so that the
// system call itself sleeps until a signal interrupts it; should the call
// retry, later signals rescue it so that the test fails instead of hanging.

volatile sig_atomic_t signalsSeen;
int rescueFd = -1;
const sockaddr_in *rescueAddress;

void rescue_after_first_signal(int)
{
    signalsSeen = signalsSeen + 1;
    if (signalsSeen < 2)
        return;
    if (rescueAddress != nullptr) {
        const int fd = socket(AF_INET, SOCK_STREAM, 0);
        (void)connect(fd, reinterpret_cast<const sockaddr *>(rescueAddress), sizeof *rescueAddress);
    } else {
        (void)write(rescueFd, "r", 1);
    }
}

class Interrupted : public GreenIo {
protected:
    void SetUp() override
    {
        GreenIo::SetUp();
        signalsSeen = 0;
        struct sigaction action = {};
        action.sa_handler = rescue_after_first_signal;
        action.sa_flags = 0; // no SA_RESTART: the system call fails with EINTR
        sigaction(SIGALRM, &action, &previous);
        itimerval every = {{0, 50000}, {0, 50000}};
        setitimer(ITIMER_REAL, &every, nullptr);
    }
    void TearDown() override
    {
        itimerval off = {};
        setitimer(ITIMER_REAL, &off, nullptr);
        sigaction(SIGALRM, &previous, nullptr);
    }
    struct sigaction previous = {};
};

TEST_F(Interrupted, ReadReturnsEintrWithoutRetrying)
{
    int fds[2];
    ASSERT_EQ(pipe(fds), 0); // blocking
    rescueFd = fds[1];
    rescueAddress = nullptr;
    int result = 0, error = 0;
    char byte;
    auto reader = [&] {
        result = nb_read(fds[0], &byte, 1);
        error = errno;
    };
    spawn(&reader);
    greenthreads_run();
    EXPECT_EQ(result, -1);
    EXPECT_EQ(error, EINTR);
    close(fds[0]);
    close(fds[1]);
}

TEST_F(Interrupted, AcceptReturnsEintrWithoutRetrying)
{
    Listener listener;
    ASSERT_GE(listener.fd, 0);
    fcntl(listener.fd, F_SETFL, fcntl(listener.fd, F_GETFL) & ~O_NONBLOCK);
    rescueAddress = &listener.addr;
    int result = 0, error = 0;
    auto server = [&] {
        result = nb_accept(listener.fd, nullptr, nullptr);
        error = errno;
    };
    spawn(&server);
    greenthreads_run();
    EXPECT_EQ(result, -1);
    EXPECT_EQ(error, EINTR);
}

// ---------------------------------------------------------------------------
// A descriptor the selector refuses makes every call fail with the
// registration's errno instead of retrying for ever.

TEST_F(NbCalls, RefusedRegistrationEndsEveryCallWithItsErrno)
{
    SocketPair empty, full;
    Listener listener;
    ASSERT_GE(listener.fd, 0);
    const int client = tcp_socket();
    // Fill a send buffer so that a write would block.
    std::vector<char> filler(64 * 1024, 'f');
    while (write(full.fd[1], filler.data(), filler.size()) > 0) {
    }
    for (int fd : {empty.fd[0], full.fd[1], listener.fd, client})
        ASSERT_EQ(SelAddFD(fd, SEL_EXCEPT, 0, ignore_event, nullptr), 0);

    struct Outcome {
        int result = 0, error = 0;
    } read1, readall, write1, accept1, connect1;
    char buf[8];
    auto caller = [&] {
        read1.result = nb_read(empty.fd[0], buf, sizeof buf);
        read1.error = errno;
        readall.result = nb_readall(empty.fd[0], buf, sizeof buf);
        readall.error = errno;
        write1.result = nb_write(full.fd[1], filler.data(), filler.size());
        write1.error = errno;
        accept1.result = nb_accept(listener.fd, nullptr, nullptr);
        accept1.error = errno;
        connect1.result = nb_connect(client, listener.address(), sizeof listener.addr);
        connect1.error = errno;
    };
    spawn(&caller);
    greenthreads_run();
    for (const Outcome &o : {read1, readall, write1, accept1}) {
        EXPECT_EQ(o.result, -1);
        EXPECT_EQ(o.error, EBUSY);
    }
    // A loopback connection may be established at once, without a wait.
    if (connect1.result != 0) {
        EXPECT_EQ(connect1.result, -1);
        EXPECT_EQ(connect1.error, EBUSY);
    }
    for (int fd : {empty.fd[0], full.fd[1], listener.fd, client}) {
        EXPECT_EQ(registered_events(fd), SEL_EXCEPT) << "the other registration of " << fd << " was lost";
        SelRemFD(fd);
    }
    close(client);
}

} // namespace
