// Shared set-up for the selector's white-box tests.
#ifndef QORBU_TESTS_SELECTOR_FIXTURE_H
#define QORBU_TESTS_SELECTOR_FIXTURE_H

#include <gtest/gtest.h>

#include "selector/sel_private.h"

namespace qorbu::test {

class SelectorTest : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_EQ(SelInit(), 0);
        ctx = SelCurrentContext();
        ASSERT_NE(ctx, nullptr);
    }
    SelContext *ctx = nullptr;
};

inline int noop_fd_callback(int, unsigned, void *, SelFdEntry *) { return 0; }
inline int noop_timer_callback(SelTimer *) { return 0; }

} // namespace qorbu::test

#endif
