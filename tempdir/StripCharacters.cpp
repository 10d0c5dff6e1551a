#include "tempdir/StripCharacters.h"

#include <stdexcept>
#include <string_view>

#include "support/Text.h"

namespace kov {

std::string stripCharacters(const std::string& text, const std::string& characters,
                            StripMode mode) {
    if (text.empty() || characters.empty()) {
        return text;
    }
    // The strip runs on the UTF-8 form, where every byte below 0x80 is a whole character: in a
    // double-byte code page the second byte of a character may equal a separator ("\x83\x5C" is
    // one character in code page 932), and stripping the narrow bytes would cut it in half.
    std::string utf8;
    if (!kov::text::narrowToUtf8(text, utf8)) {
        throw std::range_error("stripCharacters: the text is not valid in the narrow code page");
    }
    const auto bits = static_cast<int>(mode);
    std::string::size_type first = 0;
    std::string::size_type end = utf8.size();  // one past the last kept byte

    if ((bits & static_cast<int>(StripMode::leading)) != 0) {
        first = utf8.find_first_not_of(characters);
        if (first == std::string::npos) {
            return std::string();  // every byte is in the set
        }
    }
    if ((bits & static_cast<int>(StripMode::trailing)) != 0) {
        const auto last = utf8.find_last_not_of(characters);
        if (last == std::string::npos) {
            return std::string();  // every byte is in the set
        }
        end = last + 1;
    }
    std::string result;
    if (!kov::text::utf8ToNarrow(std::string_view(utf8).substr(first, end - first), result)) {
        throw std::range_error("stripCharacters: the stripped text has no narrow form");
    }
    return result;
}

}  // namespace kov
