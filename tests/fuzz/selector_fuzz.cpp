// The timer heap under the seeded test's operation interpreter; a difference
// from the reference heap aborts.
#include <cstdio>
#include <cstdlib>

#include "selector/heap_interpreter.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    static const bool ready = SelInit() == 0;
    static qorbu::test::HeapInterpreter interpreter;
    const std::string error = ready ? interpreter.run(data, size) : "SelInit failed";
    return error.empty() ? 0 : (fputs((error + "\n").c_str(), stderr), abort(), 0);
}
