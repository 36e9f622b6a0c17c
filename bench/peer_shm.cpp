// Shared-memory allocation: libqorbu's buddy allocator with and without the
// descriptor lock against Boost.Interprocess managed_shared_memory, with glibc
// malloc as floor; in one process and in two processes sharing a segment.
#include <boost/interprocess/managed_shared_memory.hpp>

#include <fcntl.h>
#include <memory>
#include <sys/file.h>
#include <sys/wait.h>
#include <unistd.h>

#include "harness.h"
#include "shm/shm.h"

using namespace bench;
namespace bip = boost::interprocess;

namespace {

constexpr uint32_t kSegment = 256u << 20;
constexpr int kLive = 10000;
constexpr uint32_t kMinSize = 16, kMaxSize = 4096;
constexpr long kWarmUpOps = 20000;

struct Heap {
    virtual ~Heap() = default;
    virtual void *alloc(uint32_t n) = 0;
    virtual void release(void *p) = 0;
};

struct QorbuHeap : Heap {
    ShmHandle *h;
    explicit QorbuHeap(ShmHandle *handle) : h(handle) {}
    void *alloc(uint32_t n) override { return ShmAlloc(h, n); }
    void release(void *p) override { ShmFree(h, p); }
};

struct BoostHeap : Heap {
    bip::managed_shared_memory *m;
    explicit BoostHeap(bip::managed_shared_memory *seg) : m(seg) {}
    void *alloc(uint32_t n) override { return m->allocate(n, std::nothrow); }
    void release(void *p) override { m->deallocate(p); }
};

// The descriptor-lock calls of a locked allocation and free, alone: two
// each, so four per pair. Every instance opens its own descriptor, so
// instances in two processes exclude each other like two segment handles.
struct FlockOnly : Heap {
    int fd;
    FlockOnly() : fd(open("/dev/shm", O_RDONLY | O_DIRECTORY | O_CLOEXEC)) {}
    void *alloc(uint32_t) override {
        flock(fd, LOCK_EX);
        flock(fd, LOCK_UN);
        return this;
    }
    void release(void *) override {
        flock(fd, LOCK_EX);
        flock(fd, LOCK_UN);
    }
};

struct MallocHeap : Heap {
    void *alloc(uint32_t n) override { return malloc(n); }
    void release(void *p) override { free(p); }
};

uint32_t random_size(Rng &r) { return kMinSize + r.below(kMaxSize - kMinSize + 1); }

// A heap with its live blocks: the background every operation runs against.
struct Workload {
    Heap *heap;
    Rng rng;
    std::vector<void *> live;
    Workload(Heap *h, int blocks, uint64_t seed) : heap(h), rng(seed) {
        for (int i = 0; i < blocks; ++i) live.push_back(must(heap->alloc(random_size(rng))));
    }
    void release_all() {
        for (void *p : live) heap->release(p);
        live.clear();
    }
    static void *must(void *p) {
        if (!p) {
            perror("allocation failed");
            abort();
        }
        return p;
    }
    // size > 0: allocate that size and free it again; size 0: free a random
    // live block and allocate a random size in its place.
    long run(uint32_t size, long ops) {
        if (size)
            for (long k = 0; k < ops; ++k) {
                void *p = must(heap->alloc(size));
                keep(p);
                heap->release(p);
            }
        else
            for (long k = 0; k < ops; ++k) {
                void *&slot = live[rng.below(unsigned(live.size()))];
                heap->release(slot);
                slot = must(heap->alloc(random_size(rng)));
            }
        return ops;
    }
};

// --- two processes ---------------------------------------------------------------
// Each child attaches on its own, keeps half of the live blocks, warms up,
// waits for the start signal and times `ops` operations; the figure is the
// slower child's time.
using Attach = std::function<Heap *()>;

double two_processes(const Attach &attach, uint32_t size, long ops) {
    int ready[2], go[2], result[2];
    if (pipe(ready) || pipe(go) || pipe(result)) abort();
    pid_t kids[2];
    for (int c = 0; c < 2; ++c) {
        kids[c] = fork();
        if (kids[c] < 0) abort();
        if (kids[c] == 0) {
            Heap *h = attach();
            Workload w(h, kLive / 2, uint64_t(100 + c));
            // first touches of the fresh mapping (and of copy-on-write heap
            // pages) happen here, not in the timed part
            w.run(size, std::min(ops, kWarmUpOps));
            char b = 'r';
            if (write(ready[1], &b, 1) != 1 || read(go[0], &b, 1) != 1) _exit(1);
            double t0 = wall_ns();
            w.run(size, ops);
            double dt = wall_ns() - t0;
            if (write(result[1], &dt, sizeof dt) != sizeof dt) _exit(1);
            w.release_all();
            _exit(0);
        }
    }
    char b;
    for (int c = 0; c < 2; ++c)
        if (read(ready[0], &b, 1) != 1) abort();
    if (write(go[1], "gg", 2) != 2) abort();
    double worst = 0;
    for (int c = 0; c < 2; ++c) {
        double dt;
        if (read(result[0], &dt, sizeof dt) != sizeof dt) abort();
        worst = std::max(worst, dt);
    }
    for (pid_t k : kids) {
        int st;
        waitpid(k, &st, 0);
        if (!WIFEXITED(st) || WEXITSTATUS(st) != 0) {
            fprintf(stderr, "child failed\n");
            abort();
        }
    }
    for (int fd : {ready[0], ready[1], go[0], go[1], result[0], result[1]}) close(fd);
    return worst;
}

std::string name_of(const char *tag) { return "qorbu_bench_" + std::to_string(getpid()) + "_" + tag; }

ShmHandle *create_segment(const std::string &name) {
    ShmUnlink(name.c_str());
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, kSegment);
    require(h != nullptr, "ShmCreate");
    return h;
}

} // namespace

int main(int argc, char **argv) {
    Options o = Options::parse(argc, argv);

    // libqorbu: one segment never attached again (no descriptor lock), one
    // with a second read-write handle (every operation takes the descriptor
    // lock), one for the two-process runs.
    std::string n_nolock = name_of("nolock"), n_lock = name_of("lock"), n_two = name_of("two");
    ShmHandle *nolock = create_segment(n_nolock);
    ShmHandle *lock = create_segment(n_lock);
    ShmHandle *second = ShmOpen(n_lock.c_str(), O_RDWR);
    ShmHandle *two = create_segment(n_two);
    require(second && two, "ShmOpen");
    std::string b_one = name_of("boost1"), b_two = name_of("boost2");
    bip::shared_memory_object::remove(b_one.c_str());
    bip::shared_memory_object::remove(b_two.c_str());
    bip::managed_shared_memory boost_one(bip::create_only, b_one.c_str(), kSegment);
    bip::managed_shared_memory boost_two(bip::create_only, b_two.c_str(), kSegment);

    QorbuHeap q_nolock(nolock), q_lock(lock);
    BoostHeap bh(&boost_one);
    MallocHeap mh;
    FlockOnly fh;
    Heap *heaps[] = {&q_nolock, &q_lock, &bh, &mh, &fh};
    std::vector<std::unique_ptr<Workload>> ws;
    for (Heap *h : heaps) ws.emplace_back(new Workload(h, kLive, 7));
    Section one("shm_one_process", "block size (bytes)", "block size (bytes)", true,
                {ours("libqorbu"), ours("libqorbu+flock"), peer("Boost.Interprocess"),
                 floor_of("glibc malloc"), floor_of("4 flock calls")});
    auto figure = [&](uint32_t size) {
        std::vector<Contender> cs;
        for (size_t i = 0; i < ws.size(); ++i) {
            Workload *w = ws[i].get();
            cs.push_back({one.columns[i].name, timed(o, [w, size](long ops) { w->run(size, ops); })});
        }
        return interleave(o, cs);
    };
    for (uint32_t size : {16u, 64u, 256u, 1024u, 4096u})
        one.add(std::to_string(size), size, "", figure(size));
    one.add("mixed 16..4096", NAN, "", figure(0));
    fprintf(stderr, "shm: one process done\n");

    Section twop(
        "shm_two_processes", "operation", "", false,
        {ours("libqorbu"), peer("Boost.Interprocess"), floor_of("glibc malloc"), floor_of("4 flock calls")});
    std::string two_name = n_two;
    std::vector<Attach> attach = {
        [two_name]() -> Heap * {
            ShmHandle *h = ShmOpen(two_name.c_str(), O_RDWR);
            if (!h) {
                perror("ShmOpen");
                _exit(1);
            }
            return new QorbuHeap(h);
        },
        [b_two]() -> Heap * {
            return new BoostHeap(new bip::managed_shared_memory(bip::open_only, b_two.c_str()));
        },
        []() -> Heap * { return new MallocHeap; },
        []() -> Heap * { return new FlockOnly; },
    };
    for (uint32_t size : {0u, 256u}) {
        std::vector<Contender> cs;
        for (size_t i = 0; i < attach.size(); ++i) {
            Attach at = attach[i];
            auto sample = [at, size](long ops) { return two_processes(at, size, ops); };
            cs.push_back({twop.columns[i].name, Calibrated(o, sample, 1000)});
        }
        twop.add(size ? "pair of 256 bytes" : "mixed 16..4096", NAN, "", interleave(o, cs));
    }
    fprintf(stderr, "shm: two processes done\n");

    auto boost = [](const Section &s) { return [&s](size_t r) { return s.at(r, "Boost.Interprocess"); }; };
    one.verdicts.push_back(
        check(one, "without the descriptor lock at most a quarter of Boost's cost (ratio to Boost)",
              "libqorbu", boost(one), 0.25));
    one.verdicts.push_back(
        check(one, "with the descriptor lock at most 3x Boost's cost", "libqorbu+flock", boost(one), 3.0));
    twop.verdicts.push_back(
        check(twop, "two contending processes at most Boost's cost", "libqorbu", boost(twop), 1.0));
    write(o, one);
    write(o, twop);

    for (auto &w : ws) w->release_all();
    for (ShmHandle *h : {nolock, second, lock, two}) ShmClose(h);
    for (auto &n : {n_nolock, n_lock, n_two}) ShmUnlink(n.c_str());
    bip::shared_memory_object::remove(b_one.c_str());
    bip::shared_memory_object::remove(b_two.c_str());
    return 0;
}
