/* Allocation and free pairs on a shared segment with a working set of 10^4
 * live blocks: one handle (no descriptor lock) or after a second read-write
 * attach (descriptor lock taken), alone or with a second process doing the
 * same on the same segment. */
#include "shm/shm.h"

#include <benchmark/benchmark.h>
#include <csignal>
#include <fcntl.h>
#include <random>
#include <string>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace {

constexpr int kWorkingSet = 10000;
constexpr int kContenderWorkingSet = 10000;
constexpr uint32_t kSegmentBytes = 64u << 20;
constexpr size_t kScript = 1 << 16;  // precomputed (slot, size) pairs, replayed

struct Script {
    std::vector<uint32_t> slots;
    std::vector<uint32_t> sizes;
};

/* Request sizes from 8 bytes to 2 KiB, log-uniform. */
Script makeScript(unsigned seed, int workingSet) {
    std::mt19937 rng(seed);
    Script s;
    for (size_t i = 0; i < kScript; i++) {
        s.slots.push_back(std::uniform_int_distribution<uint32_t>(0, workingSet - 1)(rng));
        const int bits = std::uniform_int_distribution<int>(3, 11)(rng);
        s.sizes.push_back(std::uniform_int_distribution<uint32_t>(1u << (bits - 1), 1u << bits)(rng));
    }
    return s;
}

bool fillWorkingSet(ShmHandle *h, std::vector<void *> &blocks, const Script &s) {
    for (size_t i = 0; i < blocks.size(); i++) {
        blocks[i] = ShmAlloc(h, s.sizes[i % kScript]);
        if (blocks[i] == nullptr) return false;
    }
    return true;
}

/* The second process: the same pairs, on its own handle when the
 * descriptor lock is in play, until it is killed. */
[[noreturn]] void contend(const char *name, ShmHandle *inherited, bool ownHandle) {
    ShmHandle *h = ownHandle ? ShmOpen(name, O_RDWR) : inherited;
    if (h == nullptr) _exit(1);
    const Script s = makeScript(99, kContenderWorkingSet);
    std::vector<void *> blocks(kContenderWorkingSet);
    if (!fillWorkingSet(h, blocks, s)) _exit(2);
    for (size_t i = 0;; i = (i + 1) % kScript) {
        void *&slot = blocks[s.slots[i]];
        ShmFree(h, slot);
        slot = ShmAlloc(h, s.sizes[i]);
        if (slot == nullptr) _exit(3);
        if (i == 0 && getppid() == 1) _exit(0);
    }
}

void BM_AllocFreePair(benchmark::State &state) {
    const bool descriptorLock = state.range(0) != 0;
    const bool contended = state.range(1) != 0;
    const std::string name = "qorbu-bench-" + std::to_string(getpid());
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, kSegmentBytes);
    if (h == nullptr) {
        state.SkipWithError("ShmCreate failed");
        return;
    }
    ShmHandle *second = descriptorLock ? ShmOpen(name.c_str(), O_RDWR) : nullptr;
    const Script s = makeScript(7, kWorkingSet);
    std::vector<void *> blocks(kWorkingSet);
    if (!fillWorkingSet(h, blocks, s)) state.SkipWithError("working set does not fit");
    const pid_t contender = contended ? fork() : -1;
    if (contender == 0) contend(name.c_str(), h, descriptorLock);

    size_t i = 0;
    for (auto _ : state) {
        void *&slot = blocks[s.slots[i]];
        ShmFree(h, slot);
        slot = ShmAlloc(h, s.sizes[i]);
        if (slot == nullptr) {
            state.SkipWithError("ShmAlloc failed");
            break;
        }
        i = (i + 1) % kScript;
    }
    state.SetItemsProcessed(state.iterations());

    if (contender > 0) {
        kill(contender, SIGKILL);
        waitpid(contender, nullptr, 0);
    }
    if (second != nullptr) ShmClose(second);
    ShmClose(h);
    ShmUnlink(name.c_str());
}

} // namespace

BENCHMARK(BM_AllocFreePair)->ArgsProduct({{0, 1}, {0, 1}})->ArgNames({"flock", "contender"})->UseRealTime();

BENCHMARK_MAIN();
