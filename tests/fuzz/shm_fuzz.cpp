/* libFuzzer target for the buddy allocator: each input is a segment shape
 * followed by operations (allocate, free, free a pointer that is no block,
 * count); after every operation the lists must equal the reference model's
 * and pass the independent list checks, and every live block keeps its
 * pattern. Built and run by the fuzz preset (tests/fuzz/CMakeLists.txt). */
#include "shm/shm.h"
#include "shm/shm_model.h" // tests/shm

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <unistd.h>
#include <vector>

using namespace qorbu::test;

namespace {

constexpr uint32_t kMaxPages = 64;
constexpr char kMismatch[] = "ShmFree(): mismatched handle and pointer\n";

[[noreturn]] void fail(const char *what, const std::string &detail = "") {
    fprintf(stderr, "shm fuzz: %s %s\n", what, detail.c_str());
    abort();
}

class Input {
  public:
    Input(const uint8_t *data, size_t size) : data_(data), size_(size) {}
    bool empty() const { return at_ >= size_; }
    uint8_t byte() { return at_ < size_ ? data_[at_++] : 0; }
    uint32_t word() {
        uint32_t w = 0;
        for (int i = 0; i < 4; i++) w = w << 8 | byte();
        return w;
    }

  private:
    const uint8_t *data_;
    size_t size_;
    size_t at_ = 0;
};

struct Live {
    uintptr_t block;
    uint32_t n;
};

unsigned char patternOf(uintptr_t block) { return static_cast<unsigned char>(block >> 3 | 1); }

bool intact(const Live &l) {
    const auto *bytes = reinterpret_cast<const unsigned char *>(l.block);
    for (uint32_t i = 0; i < l.n; i++) {
        if (bytes[i] != patternOf(l.block)) return false;
    }
    return true;
}

/* Runs ShmFree with stderr caught; returns what it wrote there. */
std::string freeCatchingStderr(ShmHandle *h, void *p) {
    static char buffer[256];
    memset(buffer, 0, sizeof buffer);
    FILE *caught = fmemopen(buffer, sizeof buffer - 1, "w");
    FILE *saved = stderr;
    stderr = caught;
    ShmFree(h, p);
    stderr = saved;
    fclose(caught);
    return buffer;
}

uint32_t requestSize(Input &in) {
    const uint8_t shape = in.byte();
    const uint32_t raw = in.word();
    if (shape >= 250) return raw; // anything, the refused sizes included
    return raw & ((1u << (shape % 24)) - 1);
}

void checkAgainstModel(ShmHandle *h, const BuddyModel &model, const std::vector<Live> &live) {
    if (!listsMatch(h->base, model)) fail("lists differ from the model");
    const std::string broken = checkLists(h->base, model.allocated());
    if (!broken.empty()) fail("list check:", broken);
    if (h->base->busy != 0) fail("busy left set");
    for (const Live &l : live) {
        if (!intact(l)) fail("a live block lost its pattern");
    }
}

void allocate(ShmHandle *h, BuddyModel &model, std::vector<Live> &live, uint32_t n) {
    const uintptr_t expected = model.alloc(n);
    errno = 0;
    const uintptr_t got = reinterpret_cast<uintptr_t>(ShmAlloc(h, n));
    if (got != expected) fail("ShmAlloc returned another block for", std::to_string(n));
    if (got == 0) {
        if (errno != ENOMEM) fail("ShmAlloc failed without ENOMEM");
        return;
    }
    const uintptr_t word = *reinterpret_cast<uintptr_t *>(got - sizeof(uintptr_t));
    if (word != reinterpret_cast<uintptr_t>(&h->base->freeList[model.classOf(got)])) fail("class word");
    memset(reinterpret_cast<void *>(got), patternOf(got), n);
    live.push_back({got, n});
}

void release(ShmHandle *h, BuddyModel &model, std::vector<Live> &live, size_t i) {
    const Live l = live[i];
    live[i] = live.back();
    live.pop_back();
    model.free(l.block);
    ShmFree(h, reinterpret_cast<void *>(l.block));
}

/* A pointer inside a live block whose word below is the caller's pattern:
 * no block of this segment, so nothing may change. */
void freeInterior(ShmHandle *h, const std::vector<Live> &live, Input &in) {
    const Live &l = live[in.byte() % live.size()];
    const uint32_t words = l.n / sizeof(uintptr_t);
    if (words == 0) return;
    const uintptr_t p = l.block + sizeof(uintptr_t) * (1 + in.word() % words);
    if (freeCatchingStderr(h, reinterpret_cast<void *>(p)) != kMismatch) fail("interior pointer freed");
}

void countFree(ShmHandle *h, const BuddyModel &model) {
    uint32_t expected = 0;
    for (int k = 0; k < kClasses; k++) expected += uint32_t(classBytes(k) * model.list(k).size());
    if (ShmTotalFree(h) != expected) fail("ShmTotalFree");
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    Input in(data, size);
    const uint32_t page = uint32_t(getpagesize());
    const uint32_t dataBytes = (1 + in.byte() % kMaxPages) * page - in.byte() % page;
    static int counter = 0;
    const std::string name = "qorbu-fuzz-" + std::to_string(getpid()) + "-" + std::to_string(counter++);
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, dataBytes);
    if (h == nullptr) fail("ShmCreate", strerror(errno));
    ShmUnlink(name.c_str());
    BuddyModel model(reinterpret_cast<uintptr_t>(h->base), h->size);
    std::vector<Live> live;

    while (!in.empty()) {
        switch (in.byte() % 5) {
        case 0:
        case 1: allocate(h, model, live, requestSize(in)); break;
        case 2:
            if (!live.empty()) release(h, model, live, in.byte() % live.size());
            break;
        case 3:
            if (!live.empty()) freeInterior(h, live, in);
            break;
        default: countFree(h, model); break;
        }
        checkAgainstModel(h, model, live);
    }
    while (!live.empty()) release(h, model, live, live.size() - 1);
    checkAgainstModel(h, model, live);
    if (ShmTotalFree(h) != h->size - page) fail("not everything came back");
    ShmClose(h);
    return 0;
}
