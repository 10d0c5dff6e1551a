// Fuzz target for the text rules: the native path form of both styles,
// path splitting and joining, and stripCharacters. Every input is decoded
// by the layout given in text_rules_invariants.h; an input that breaks one
// of the properties stops the run with the property's description (and
// libFuzzer keeps the input as a crash file).
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "text_rules_invariants.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string failure = kov::fuzz::checkTextRules(data, size);
    if (!failure.empty()) {
        std::fprintf(stderr, "text rule broken: %s\n", failure.c_str());
        std::abort();
    }
    return 0;
}
