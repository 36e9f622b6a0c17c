/* libFuzzer target for the buddy allocator: byte 0 sizes a segment that the
 * library places, the rest feed the operation run of tests/shm/shm_ops.h. */
#include "shm/shm_ops.h"

#include <cstdlib>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size == 0) return 0;
    const std::string name = "qorbu-fuzz-" + std::to_string(getpid());
    const uint32_t bytes = uint32_t(1 + data[0] % 64) * uint32_t(qorbu::test::page_bytes()) - data[0];
    ShmHandle *h = ShmCreate(name.c_str(), nullptr, bytes);
    ShmUnlink(name.c_str());
    auto next = [at = data + 1, end = data + size]() mutable {
        uint32_t v = 0;
        for (int i = 0; i < 4 && at < end; i++) v = v << 8 | *at++;
        return v;
    };
    const std::string broken =
        h != nullptr ? qorbu::test::OperationRun(h, true).run(next, int(size / 8)) : "ShmCreate";
    if (!broken.empty()) fprintf(stderr, "shm fuzz: %s\n", broken.c_str()), abort();
    ShmClose(h);
    return 0;
}
