// Fuzz target for the store's three classes. The input is a program of host actions (see
// tests/lib/store_program.h): the first byte chooses the variant, every later byte feeds the choices
// of the program (table creation of every kind, out-of-range kinds included; read and writing
// cursors; every cursor operation with matching and mismatching key forms; table creation with
// cursors open; reset; destruction of cursors and tables in any order; copies of the pager taken,
// assigned back and reset, failed() and failure()). Every answer is checked against the model
// until the model can no longer follow (a copy assigned back or reset); a mismatch stops the run
// with its description (libFuzzer keeps the input). From then on the program only drives the
// store, for the sanitizers to watch.
//
// The first byte chooses the variant (kovtest::fuzzVariant).
#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include "store_program.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size == 0)
        return 0;
    kovtest::ByteChoices choices(data + 1, size - 1);
    kovtest::StoreProgram program(choices, kovtest::fuzzVariant(data[0]));
    program.run(1000);
    if (program.mismatches() != 0) {
        for (const auto& text : program.mismatchTexts())
            std::fprintf(stderr, "store mismatch: %s\n", text.c_str());
        std::abort();
    }
    return 0;
}
