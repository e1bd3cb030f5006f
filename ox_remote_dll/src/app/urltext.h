// The escaping of call-back arguments.
#pragma once

#include <string>
#include <string_view>

// "+" becomes a blank and "%XX" the byte, in one pass; a "%" without two hexadecimal digits stays. A decoded NUL ends
// the text.
std::string DecodeUrlText(std::string_view text);
// The same in a C string's own buffer.
void DecodeUrlTextInPlace(char* text);
// The same, but a decoded NUL is a byte like any other, for callers that must see it.
std::string DecodeUrlBytes(std::string_view text);
