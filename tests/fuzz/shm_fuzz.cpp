/* libFuzzer target for the buddy allocator: the first byte sizes a segment
 * that the library places, every five further bytes are an operation of
 * the run in tests/shm/shm_ops.h. */
#include "shm/shm_ops.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    using namespace qorbu::test;
    if (size == 0) return 0;
    static int counter = 0;
    const std::string name = "qorbu-fuzz-" + std::to_string(getpid()) + "-" + std::to_string(counter++);
    ShmHandle *h =
        ShmCreate(name.c_str(), nullptr, uint32_t(1 + data[0] % 64) * uint32_t(page_bytes()) - data[0]);
    ShmUnlink(name.c_str());
    if (h == nullptr) abort();
    OperationRun run(h);
    std::string broken;
    for (size_t i = 1; i + 5 <= size && broken.empty(); i += 5) {
        uint32_t arg;
        memcpy(&arg, data + i + 1, sizeof arg);
        broken = run.step(data[i], arg);
    }
    if (broken.empty()) broken = run.finish();
    ShmClose(h);
    if (!broken.empty()) fprintf(stderr, "shm fuzz: %s\n", broken.c_str()), abort();
    return 0;
}
