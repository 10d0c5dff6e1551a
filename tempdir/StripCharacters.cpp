#include "tempdir/StripCharacters.h"

namespace kov {

std::string stripCharacters(const std::string& text, const std::string& characters,
                            StripMode mode) {
    if (text.empty() || characters.empty()) {
        return text;
    }
    const auto bits = static_cast<int>(mode);
    std::string::size_type first = 0;
    std::string::size_type end = text.size();  // one past the last kept byte

    if ((bits & static_cast<int>(StripMode::leading)) != 0) {
        first = text.find_first_not_of(characters);
        if (first == std::string::npos) {
            return std::string();  // every byte is in the set
        }
    }
    if ((bits & static_cast<int>(StripMode::trailing)) != 0) {
        const auto last = text.find_last_not_of(characters);
        if (last == std::string::npos) {
            return std::string();  // every byte is in the set
        }
        end = last + 1;
    }
    return text.substr(first, end - first);
}

}  // namespace kov
