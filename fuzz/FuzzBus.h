// SPDX-License-Identifier: MIT
// What the targets that build messages share: sd-bus messages without a bus daemon (sd-bus only
// creates messages on a started bus, so the process starts one on one end of a socket pair that
// nothing ever reads), and the sizes of the large dictionaries they build.
#pragma once

#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

#include "fuzz/FuzzSupport.h"

namespace halvex::fuzz {

using Message = std::unique_ptr<sd_bus_message, decltype(&sd_bus_message_unref)>;

inline sd_bus* scratchBus() {
  // Lives as long as the process, as the fuzzer does.
  static sd_bus* const bus = [] {
    int fds[2] = {-1, -1};
    sd_bus* started = nullptr;
    check(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) == 0, "socket pair");
    check(sd_bus_new(&started) >= 0, "sd_bus_new");
    check(sd_bus_set_fd(started, fds[0], fds[0]) >= 0, "sd_bus_set_fd");
    check(sd_bus_start(started) >= 0, "sd_bus_start");
    return started;
  }();
  return bus;
}

inline Message newMessage() {
  sd_bus_message* raw = nullptr;
  check(sd_bus_message_new_method_call(scratchBus(), &raw, "org.halvex.Fuzz", "/org/halvex/Fuzz",
                                       "org.halvex.Fuzz1", "Echo") >= 0,
        "new message");
  return Message(raw, &sd_bus_message_unref);
}

// Seals the message as sending would and rewinds it for reading, as a received one would be.
// Returns sd-bus's verdict on the seal.
inline int sealForReading(sd_bus_message* message) {
  const int r = sd_bus_message_seal(message, 1, 0);
  if (r < 0) {
    return r;
  }
  return sd_bus_message_rewind(message, 1);
}

// Sizes of the rare large dictionaries: around the entry limit, at most one per input since
// filling a MessageDict is quadratic, or small enough to nest past the value limit (32 x 32 x 17).
class LargeSizes {
 public:
  std::size_t pick(std::uint8_t choice) {
    constexpr std::size_t kSizes[] = {17, 32, 64, 100, 1023, 1024, 1025, 1030};
    std::size_t size = kSizes[choice & 7u];
    if (size >= 1000) {
      size = aroundLimitTaken_ ? kSizes[1] : size;
      aroundLimitTaken_ = true;
    }
    return size;
  }

 private:
  bool aroundLimitTaken_ = false;
};

// Keys of large dictionaries differ in length, so that the lookups of MessageDict::set, which
// are what makes filling one quadratic, compare sizes rather than bytes.
inline std::string largeKey(std::size_t index) {
  return std::string(index + 1, 'k');
}

}  // namespace halvex::fuzz
