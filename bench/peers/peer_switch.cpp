// Context switching: a libqorbu green-thread switch against a bare
// swapcontext and Boost.Context, and creating a thread and running it to its
// end (libqorbu reuses a finished record with its stack).
#include <boost/context/fiber.hpp>
#include <boost/context/pooled_fixedsize_stack.hpp>
#include <ucontext.h>

#include <memory>
#include <signal.h>

#include "greenthreads/greenthread.h"
#include "harness.h"
#include "selector/sel.h"

using namespace bench;
namespace ctx = boost::context;

namespace {

constexpr size_t kStack = 16384;

// --- libqorbu ----------------------------------------------------------------
long yields_left = 0;
void yielder(void *) {
    while (yields_left-- > 0) greenthread_yield();
}
void nothing(void *) {}

// One green thread yielding to the main context, which yields back from
// greenthreads_run: two switches per yield.
long qorbu_switches(long ops) {
    yields_left = ops / 2;
    greenthread_create(yielder, nullptr);
    greenthreads_run();
    return ops;
}

long qorbu_create_finish(long ops) {
    for (long k = 0; k < ops; ++k) {
        greenthread_create(nothing, nullptr);
        greenthreads_run();
    }
    return ops;
}

// --- bare swapcontext ----------------------------------------------------------
ucontext_t uc_main, uc_co;
std::unique_ptr<char[]> uc_stack(new char[kStack]);

void bounce() {
    for (;;) swapcontext(&uc_co, &uc_main);
}

long uc_switches(long ops) {
    getcontext(&uc_co);
    uc_co.uc_stack.ss_sp = uc_stack.get();
    uc_co.uc_stack.ss_size = kStack;
    uc_co.uc_link = nullptr;
    makecontext(&uc_co, bounce, 0);
    for (long k = 0; k < ops / 2; ++k) swapcontext(&uc_main, &uc_co);
    return ops;
}

void finish_at_once() {}

// makecontext on a reused stack, switch in, return through uc_link.
long uc_create_finish(long ops) {
    getcontext(&uc_co);
    for (long k = 0; k < ops; ++k) {
        uc_co.uc_stack.ss_sp = uc_stack.get();
        uc_co.uc_stack.ss_size = kStack;
        uc_co.uc_link = &uc_main;
        makecontext(&uc_co, finish_at_once, 0);
        swapcontext(&uc_main, &uc_co);
    }
    return ops;
}

// --- Boost.Context ----------------------------------------------------------------
long boost_switches(long ops) {
    bool stop = false;
    ctx::fiber f{[&stop](ctx::fiber &&main) {
        while (!stop) main = std::move(main).resume();
        return std::move(main);
    }};
    for (long k = 0; k < ops / 2; ++k) f = std::move(f).resume();
    stop = true;
    f = std::move(f).resume(); // let it return
    return ops;
}

long boost_create_finish(long ops) {
    ctx::pooled_fixedsize_stack pool(kStack);
    for (long k = 0; k < ops; ++k) {
        ctx::fiber f{std::allocator_arg, pool, [](ctx::fiber &&main) { return std::move(main); }};
        f = std::move(f).resume();
    }
    return ops;
}

// --- floor: the signal-mask system call a switch that keeps the mask makes ---------
long mask_calls(long ops, int per_op) {
    sigset_t current;
    sigprocmask(SIG_BLOCK, nullptr, &current);
    for (long k = 0; k < ops * per_op; ++k) sigprocmask(SIG_SETMASK, &current, nullptr);
    return ops;
}

} // namespace

int main(int argc, char **argv) {
    Options o = Options::parse(argc, argv);
    SelInit();
    greenthreads_init();

    Section s{"switching", "Switching",
              "switch: one transfer of control between two contexts (a green thread yielding to the main "
              "context and back; a pair of `swapcontext` calls; a pair of Boost.Context `fiber::resume`). "
              "create+finish: create a thread and run it until its (empty) entry function has returned: "
              "`greenthread_create` + `greenthreads_run` (the finished record and stack are reused); "
              "`makecontext` on a reused stack + `swapcontext` + return through `uc_link`; a Boost.Context "
              "fiber on a pooled stack resumed once. Bare `swapcontext` and libqorbu save and restore the "
              "signal mask (one system call per switch); Boost.Context does not. The floor is that system call "
              "alone: one `sigprocmask` per switch, two per create+finish (two switches).",
              "operation", "", false,
              {{"libqorbu", Role::Ours},
               {"swapcontext", Role::Peer},
               {"Boost.Context", Role::Peer},
               {"sigprocmask", Role::Floor}},
              {},
              {}};

    Timed q_sw(o, qorbu_switches), u_sw(o, uc_switches), b_sw(o, boost_switches);
    Timed f_sw(o, [](long ops) { return mask_calls(ops, 1); });
    std::vector<Contender> sw = {{"libqorbu", Role::Ours, [&] { return q_sw(); }},
                                 {"swapcontext", Role::Peer, [&] { return u_sw(); }},
                                 {"Boost.Context", Role::Peer, [&] { return b_sw(); }},
                                 {"sigprocmask", Role::Floor, [&] { return f_sw(); }}};
    s.add("switch", NAN, "", interleave(o, sw));

    Timed q_cf(o, qorbu_create_finish), u_cf(o, uc_create_finish), b_cf(o, boost_create_finish);
    Timed f_cf(o, [](long ops) { return mask_calls(ops, 2); });
    std::vector<Contender> cf = {{"libqorbu", Role::Ours, [&] { return q_cf(); }},
                                 {"swapcontext", Role::Peer, [&] { return u_cf(); }},
                                 {"Boost.Context", Role::Peer, [&] { return b_cf(); }},
                                 {"sigprocmask", Role::Floor, [&] { return f_cf(); }}};
    s.add("create+finish", NAN, "", interleave(o, cf));

    s.verdicts.push_back(check(s, "a green-thread switch at most 1.1x a bare swapcontext", "libqorbu",
                               [&](size_t r) { return s.at(r, "swapcontext"); }, 1.1,
                               [&](size_t r) { return s.rows[r].label == "switch"; }));
    s.verdicts.push_back(check(s, "create+finish with a reused record at most 1 us (ratio to 1000 ns)", "libqorbu",
                               [](size_t) { return 1000.0; }, 1.0,
                               [&](size_t r) { return s.rows[r].label == "create+finish"; }));
    write(o, s);
    return 0;
}
