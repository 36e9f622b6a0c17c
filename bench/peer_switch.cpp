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
void qorbu_switches(long ops) {
    yields_left = ops / 2;
    greenthread_create(yielder, nullptr);
    greenthreads_run();
}

void qorbu_create_finish(long ops) {
    for (long k = 0; k < ops; ++k) {
        greenthread_create(nothing, nullptr);
        greenthreads_run();
    }
}

// --- bare swapcontext ----------------------------------------------------------
ucontext_t uc_main, uc_co;
std::unique_ptr<char[]> uc_stack(new char[kStack]);

void bounce() {
    for (;;) swapcontext(&uc_co, &uc_main);
}

void uc_switches(long ops) {
    getcontext(&uc_co);
    uc_co.uc_stack.ss_sp = uc_stack.get();
    uc_co.uc_stack.ss_size = kStack;
    uc_co.uc_link = nullptr;
    makecontext(&uc_co, bounce, 0);
    for (long k = 0; k < ops / 2; ++k) swapcontext(&uc_main, &uc_co);
}

void finish_at_once() {}

// makecontext on a reused stack, switch in, return through uc_link.
void uc_create_finish(long ops) {
    getcontext(&uc_co);
    for (long k = 0; k < ops; ++k) {
        uc_co.uc_stack.ss_sp = uc_stack.get();
        uc_co.uc_stack.ss_size = kStack;
        uc_co.uc_link = &uc_main;
        makecontext(&uc_co, finish_at_once, 0);
        swapcontext(&uc_main, &uc_co);
    }
}

// --- Boost.Context ----------------------------------------------------------------
void boost_switches(long ops) {
    bool stop = false;
    ctx::fiber f{[&stop](ctx::fiber &&main) {
        while (!stop) main = std::move(main).resume();
        return std::move(main);
    }};
    for (long k = 0; k < ops / 2; ++k) f = std::move(f).resume();
    stop = true;
    f = std::move(f).resume(); // let it return
}

void boost_create_finish(long ops) {
    ctx::pooled_fixedsize_stack pool(kStack);
    for (long k = 0; k < ops; ++k) {
        ctx::fiber f{std::allocator_arg, pool, [](ctx::fiber &&main) { return std::move(main); }};
        f = std::move(f).resume();
    }
}

// --- floor: the signal-mask system call a switch that keeps the mask makes ---------
void mask_calls(long ops, int per_op) {
    sigset_t current;
    sigprocmask(SIG_BLOCK, nullptr, &current);
    for (long k = 0; k < ops * per_op; ++k) sigprocmask(SIG_SETMASK, &current, nullptr);
}

} // namespace

int main(int argc, char **argv) {
    Options o = Options::parse(argc, argv);
    SelInit();
    greenthreads_init();

    Section s("switching", "operation", "", false,
              {ours("libqorbu"), peer("swapcontext"), peer("Boost.Context"), floor_of("sigprocmask")});
    auto row = [&](const char *label, std::vector<void (*)(long)> bodies) {
        std::vector<Contender> cs;
        for (size_t i = 0; i < bodies.size(); ++i) cs.push_back({s.columns[i].name, timed(o, bodies[i])});
        s.add(label, NAN, "", interleave(o, cs));
    };
    row("switch", {qorbu_switches, uc_switches, boost_switches, [](long ops) { mask_calls(ops, 1); }});
    row("create+finish",
        {qorbu_create_finish, uc_create_finish, boost_create_finish, [](long ops) { mask_calls(ops, 2); }});

    s.verdicts.push_back(check(
        s, "a green-thread switch at most 1.1x a bare swapcontext", "libqorbu",
        [&](size_t r) { return s.at(r, "swapcontext"); }, 1.1,
        [&](size_t r) { return s.rows[r].label == "switch"; }));
    s.verdicts.push_back(check(
        s, "create+finish with a reused record at most 1 us (ratio to 1000 ns)", "libqorbu",
        [](size_t) { return 1000.0; }, 1.0, [&](size_t r) { return s.rows[r].label == "create+finish"; }));
    write(o, s);
    return 0;
}
