#include <cerrno>
#include <fcntl.h>
#include <unistd.h>

#include <vector>

#include "selector_fixture.h"

using qorbu::test::noop_fd_callback;
using qorbu::test::SelectorTest;

namespace {

int tag_a, tag_b;

struct Call {
    int fd;
    unsigned event;
};
std::vector<Call> calls;
int record_call(int fd, unsigned event, void *, SelFdEntry *) {
    calls.push_back({fd, event});
    return 0;
}

} // namespace

TEST_F(SelectorTest, AddRefusesBadArguments) {
    struct Case {
        int fd;
        unsigned events;
        SelFdCallback callback;
    } cases[] = {{5, SEL_IN_CALLBACK, noop_fd_callback},
                 {5, SEL_READ | 16u, noop_fd_callback},
                 {-1, SEL_READ, noop_fd_callback},
                 {FD_SETSIZE, SEL_READ, noop_fd_callback},
                 {5000, 0, noop_fd_callback},
                 {5, SEL_READ, nullptr}, // nothing to call
                 {5, 0, nullptr}};
    for (const Case &c : cases) {
        errno = 0;
        EXPECT_EQ(SelAddFD(c.fd, c.events, 0, c.callback, nullptr), -1) << c.fd;
        EXPECT_EQ(errno, EINVAL) << c.fd;
    }
    // Nothing was written past the fd_set or into the table.
    EXPECT_EQ(ctx->nfds, 0);
    EXPECT_LE(ctx->fdTableSize, 6);
    EXPECT_EQ(SelAddFD(FD_SETSIZE - 1, SEL_READ, 0, noop_fd_callback, nullptr), 0);
    EXPECT_EQ(ctx->nfds, FD_SETSIZE);
    EXPECT_TRUE(FD_ISSET(FD_SETSIZE - 1, &ctx->readSet));
}

TEST_F(SelectorTest, SecondRegistrationIsBusyAndKeepsTheFirst) {
    ASSERT_EQ(SelAddFD(4, SEL_READ, 0, noop_fd_callback, &tag_a), 0);
    errno = 0;
    EXPECT_EQ(SelAddFD(4, SEL_WRITE, 1, record_call, &tag_b), -1);
    EXPECT_EQ(errno, EBUSY);
    EXPECT_EQ(ctx->fdTable[4].events, SEL_READ);
    EXPECT_EQ(ctx->fdTable[4].callback, noop_fd_callback);
    EXPECT_EQ(SelGetFDArg(4), &tag_a);
    EXPECT_FALSE(FD_ISSET(4, &ctx->writeSet));
}

TEST_F(SelectorTest, EmptyMaskStoresButLeavesSlotFree) {
    ASSERT_EQ(SelAddFD(3, SEL_READ, 0, noop_fd_callback, nullptr), 0);
    ASSERT_EQ(SelAddFD(7, 0, 0, noop_fd_callback, &tag_a), 0);
    EXPECT_EQ(ctx->nfds, 4);
    EXPECT_EQ(ctx->fdTable[7].events, 0u);
    EXPECT_EQ(ctx->fdTable[7].arg, &tag_a);
    EXPECT_EQ(SelAddFD(7, SEL_WRITE, 0, noop_fd_callback, nullptr), 0); // still free
}

TEST_F(SelectorTest, NfdsFollowsTheHighestRegistration) {
    ASSERT_EQ(SelAddFD(3, SEL_READ, 0, noop_fd_callback, &tag_a), 0);
    ASSERT_EQ(SelAddFD(9, SEL_EXCEPT, 0, noop_fd_callback, &tag_b), 0);
    EXPECT_EQ(ctx->nfds, 10);
    EXPECT_EQ(ctx->fdTableSize, 10); // exactly one past the highest asked for

    EXPECT_EQ(SelRemFD(9), 0);
    EXPECT_EQ(ctx->nfds, 4);
    EXPECT_FALSE(FD_ISSET(9, &ctx->exceptSet));
    errno = 0;
    EXPECT_EQ(SelRemFD(9), -1);
    EXPECT_EQ(errno, EINVAL);
    EXPECT_EQ(SelGetFDArg(9), nullptr);
    EXPECT_EQ(errno, EINVAL);

    EXPECT_EQ(SelRemFD(2), 0); // below nfds, never registered
    EXPECT_EQ(SelGetFDArg(3), &tag_a);
    EXPECT_EQ(SelRemFD(3), 0);
    EXPECT_EQ(ctx->nfds, 1);
    EXPECT_EQ(SelGetFDArg(0), nullptr);
    errno = 0;
    EXPECT_EQ(SelRemFD(-1), -1);
    EXPECT_EQ(errno, EINVAL);
}

TEST_F(SelectorTest, RemovedDescriptorKeepsItsLastArgument) {
    ASSERT_EQ(SelAddFD(5, SEL_READ, 0, noop_fd_callback, &tag_a), 0);
    ASSERT_EQ(SelAddFD(8, SEL_READ, 0, noop_fd_callback, nullptr), 0);
    ASSERT_EQ(SelRemFD(5), 0);
    EXPECT_EQ(SelGetFDArg(5), &tag_a);
}

TEST_F(SelectorTest, TableGrowsAndKeepsEntries) {
    ASSERT_EQ(SelAddFD(2, SEL_READ, 0, noop_fd_callback, &tag_a), 0);
    for (int fd = 10; fd < 1000; fd += 37) ASSERT_EQ(SelAddFD(fd, SEL_WRITE, 0, noop_fd_callback, &tag_b), 0);
    EXPECT_EQ(ctx->fdTableSize, 973); // 10 + 37 * 26 is the highest
    EXPECT_EQ(ctx->fdTable[2].arg, &tag_a);
    EXPECT_EQ(ctx->fdTable[2].events, SEL_READ);
    EXPECT_EQ(ctx->fdTable[500].events, 0u);
}

TEST_F(SelectorTest, IdleTrackingStampsOnlyWhenOne) {
    ASSERT_EQ(SelAddFD(3, SEL_READ, 1, noop_fd_callback, nullptr), 0);
    ASSERT_EQ(SelAddFD(4, SEL_READ, 0, noop_fd_callback, nullptr), 0);
    EXPECT_NE(ctx->fdTable[3].lastActivity.tv_sec, 0);
    EXPECT_EQ(ctx->fdTable[4].lastActivity.tv_sec, 0);

    ctx->fdTable[3].lastActivity.tv_sec = 1;
    SelDispatchFD(ctx, 3, SEL_READ);
    SelDispatchFD(ctx, 4, SEL_READ);
    EXPECT_GT(ctx->fdTable[3].lastActivity.tv_sec, 1);
    EXPECT_EQ(ctx->fdTable[4].lastActivity.tv_sec, 0);
}

// The guard around a running callback.
namespace {

SelContext *guard_ctx = nullptr;
int add_again_result = 0, add_again_errno = 0;
bool was_in_callback = false;
bool interest_lifted = false;

int try_add_again(int fd, unsigned, void *, SelFdEntry *entry) {
    was_in_callback = (entry->events & SEL_IN_CALLBACK) != 0;
    interest_lifted = !FD_ISSET(fd, &guard_ctx->readSet) && !FD_ISSET(fd, &guard_ctx->writeSet);
    errno = 0;
    add_again_result = SelAddFD(fd, SEL_READ, 0, noop_fd_callback, nullptr);
    add_again_errno = errno;
    return 0;
}

int remove_self(int fd, unsigned, void *, SelFdEntry *) { return SelRemFD(fd); }

int reregister_for_write(int fd, unsigned, void *, SelFdEntry *) {
    SelRemFD(fd);
    // Registering a far descriptor moves the table under the running dispatch.
    SelAddFD(900, SEL_READ, 0, noop_fd_callback, nullptr);
    return SelAddFD(fd, SEL_WRITE, 0, noop_fd_callback, nullptr);
}

int remove_other(int, unsigned, void *arg, SelFdEntry *) { return SelRemFD(*static_cast<int *>(arg)); }

} // namespace

TEST_F(SelectorTest, GuardRestoresInterestAfterTheCallback) {
    guard_ctx = ctx;
    ASSERT_EQ(SelAddFD(6, SEL_READ | SEL_WRITE, 0, try_add_again, nullptr), 0);
    SelDispatchFD(ctx, 6, SEL_READ);
    EXPECT_TRUE(was_in_callback);
    EXPECT_TRUE(interest_lifted);
    EXPECT_EQ(add_again_result, -1);
    EXPECT_EQ(add_again_errno, EBUSY);
    EXPECT_EQ(ctx->fdTable[6].events, SEL_READ | SEL_WRITE);
    EXPECT_TRUE(FD_ISSET(6, &ctx->readSet));
    EXPECT_TRUE(FD_ISSET(6, &ctx->writeSet));
}

TEST_F(SelectorTest, CallbackRemovingItselfLeavesNoInterest) {
    ASSERT_EQ(SelAddFD(6, SEL_READ | SEL_EXCEPT, 0, remove_self, nullptr), 0);
    SelDispatchFD(ctx, 6, SEL_READ);
    EXPECT_EQ(ctx->fdTable[6].events, 0u);
    EXPECT_FALSE(FD_ISSET(6, &ctx->readSet));
    EXPECT_FALSE(FD_ISSET(6, &ctx->exceptSet));
    EXPECT_EQ(ctx->nfds, 1);
}

TEST_F(SelectorTest, CallbackReregisteringKeepsOnlyTheNewMask) {
    ASSERT_EQ(SelAddFD(6, SEL_READ, 0, reregister_for_write, nullptr), 0);
    SelDispatchFD(ctx, 6, SEL_READ);
    EXPECT_EQ(ctx->fdTable[6].events, SEL_WRITE);
    EXPECT_FALSE(FD_ISSET(6, &ctx->readSet));
    EXPECT_TRUE(FD_ISSET(6, &ctx->writeSet));
    EXPECT_EQ(ctx->fdTableSize, 901);
}

TEST_F(SelectorTest, CallbackRemovingAnotherClearsItsReadyBits) {
    int other = 8;
    ASSERT_EQ(SelAddFD(5, SEL_READ, 0, remove_other, &other), 0);
    ASSERT_EQ(SelAddFD(8, SEL_READ | SEL_WRITE, 0, noop_fd_callback, nullptr), 0);
    FD_SET(8, &ctx->readyRead);
    FD_SET(8, &ctx->readyWrite);
    SelDispatchFD(ctx, 5, SEL_READ);
    EXPECT_FALSE(FD_ISSET(8, &ctx->readyRead));
    EXPECT_FALSE(FD_ISSET(8, &ctx->readyWrite));
    EXPECT_FALSE(FD_ISSET(8, &ctx->readSet));
    EXPECT_EQ(ctx->nfds, 6);
}

TEST_F(SelectorTest, DispatchPassesTheEntryAndEvent) {
    calls.clear();
    ASSERT_EQ(SelAddFD(3, SEL_EXCEPT, 0, record_call, nullptr), 0);
    SelDispatchFD(ctx, 3, SEL_EXCEPT);
    ASSERT_EQ(calls.size(), 1u);
    EXPECT_EQ(calls[0].fd, 3);
    EXPECT_EQ(calls[0].event, SEL_EXCEPT);
}
