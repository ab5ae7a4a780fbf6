// SPDX-License-Identifier: MIT
// The outcome of a request to the server or to a helper service.
#pragma once

#include <cstdint>
#include <string>

namespace halvex {

struct Result {
  // 0 is success; anything else is a failure.
  std::int32_t code = 0;
  // Text from the framework, for logs. Callers never decide on it.
  std::string message;

  bool ok() const { return code == 0; }
};

constexpr std::int32_t resultCode(std::uint32_t bits) {
  return static_cast<std::int32_t>(bits);
}

// The server is not on the bus (or there is no bus at all).
inline constexpr std::int32_t kResultServerNotRunning = resultCode(0xE020E001u);

// Failures of the transport. Each is distinct so that logs and tests can tell them apart; callers
// of the framework treat every one of them as plain failure.
// The server left the bus (crashed or quit) before it answered.
inline constexpr std::int32_t kResultServerGone = resultCode(0xE020E002u);
// No answer within the framework's time-out.
inline constexpr std::int32_t kResultTimeout = resultCode(0xE020E003u);
// Our own connection to the bus broke.
inline constexpr std::int32_t kResultConnectionLost = resultCode(0xE020E004u);
// The bus refused the call because too many calls were pending.
inline constexpr std::int32_t kResultLimitsExceeded = resultCode(0xE020E005u);
// The answer did not have the agreed shape.
inline constexpr std::int32_t kResultBadReply = resultCode(0xE020E006u);
// The request could not be sent as given (a name or value the bus cannot carry).
inline constexpr std::int32_t kResultInvalidRequest = resultCode(0xE020E007u);
// Any other error the bus reported.
inline constexpr std::int32_t kResultBusError = resultCode(0xE020E008u);

}  // namespace halvex
