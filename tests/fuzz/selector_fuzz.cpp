// libFuzzer target: the timer heap under the operation interpreter of the
// seeded test; any difference from the reference heap aborts.
#include <cstdio>
#include <cstdlib>

#include "selector/heap_interpreter.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    static const bool ready = SelInit() == 0;
    static qorbu::test::HeapInterpreter interpreter;
    const std::string error = ready ? interpreter.run(data, size) : "SelInit failed";
    if (!error.empty()) {
        fprintf(stderr, "%s\n", error.c_str());
        abort();
    }
    return 0;
}
