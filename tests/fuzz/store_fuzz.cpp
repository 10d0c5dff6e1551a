// Fuzz target for the store's three classes. The input is a program of host actions (see
// tests/store_program.h): the first byte chooses the variant, every later byte feeds the choices
// of the program (table creation of every kind, out-of-range kinds included; read and writing
// cursors; every cursor operation with matching and mismatching key forms; table creation with
// cursors open; reset; destruction of cursors and tables in any order). Every answer is checked
// against the model; a mismatch stops the run with its description (libFuzzer keeps the input).
//
// First byte: bit 0 set = tables are destroyed only after their cursors (the order the store
// asks for); bit 1 set = some records are a few KB long.
#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include "store_program.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size == 0)
        return 0;
    kovtest::ProgramOptions options;
    options.oddInputs = true;
    options.cursorsBeforeTables = (data[0] & 1) != 0;
    options.bigPercent = (data[0] & 2) != 0 ? 5 : 0;
    kovtest::ByteChoices choices(data + 1, size - 1);
    kovtest::StoreProgram program(choices, options);
    program.run(1000);
    if (program.mismatches() != 0) {
        for (const auto& text : program.mismatchTexts())
            std::fprintf(stderr, "store mismatch: %s\n", text.c_str());
        std::abort();
    }
    return 0;
}
