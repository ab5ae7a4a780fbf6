// SPDX-License-Identifier: MIT
// The one check of what a D-Bus string may hold, shared by the codec and the name checks.
#pragma once

#include <string_view>

namespace halvex::bus {

// True when text can travel as a D-Bus string unchanged: valid UTF-8 (no overlong forms, no
// surrogates, no noncharacters, as sd-bus checks it) without a NUL byte. sd-bus takes C strings,
// so a NUL would silently cut the value.
bool isBusString(std::string_view text);

}  // namespace halvex::bus
