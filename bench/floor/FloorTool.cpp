// SPDX-License-Identifier: MIT
// The floor under `halvextool logdump tel`: only the bus and /proc work that command needs, on one
// thread and one connection, with nothing of the tool's structure (no shell, no run loop, no work
// queue). bench/tool-vs-floor.sh measures the tool against it.
//
//   halvex-floor            one-shot: what `halvextool logdump tel` does, then exits
//   halvex-floor --lines    the bare client: for every line on standard input, the two calls of
//                           `logdump tel` and its two output lines, after the same start-up
#include <dirent.h>
#include <fcntl.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstring>
#include <iostream>
#include <string>
#include <thread>

#include "platform/MessageDict.h"
#include "platform/linux/BusProtocol.h"
#include "platform/linux/MessageCodec.h"

namespace {

using halvex::MessageDict;
using halvex::MessageValue;

sd_bus* gBus = nullptr;

// Calls a server method with a request and returns the "v" of its "isv" reply, or null.
MessageValue perform(const char* command, const MessageDict& request) {
  sd_bus_message* call = nullptr;
  sd_bus_message* reply = nullptr;
  MessageValue value;
  if (sd_bus_message_new_method_call(gBus, &call, halvex::bus::kServerName,
                                     halvex::bus::kServerPath, halvex::bus::kServerInterface,
                                     halvex::bus::kServerPerformCommand) >= 0 &&
      sd_bus_message_append(call, "ss", "halvextool", command) >= 0 &&
      halvex::bus::appendDict(call, request) >= 0 &&
      sd_bus_call(gBus, call, 0, nullptr, &reply) >= 0) {
    std::int32_t code = 0;
    const char* message = nullptr;
    if (sd_bus_message_read(reply, "is", &code, &message) > 0) {
      halvex::bus::readVariant(reply, value);
    }
  }
  sd_bus_message_unref(reply);
  sd_bus_message_unref(call);
  return value;
}

bool commRunning(const char* name) {
  DIR* proc = opendir("/proc");
  bool found = false;
  while (proc != nullptr && !found) {
    const dirent* entry = readdir(proc);
    if (entry == nullptr) {
      break;
    }
    char path[sizeof entry->d_name + 8];
    std::snprintf(path, sizeof path, "%s/comm", entry->d_name);
    const int fd = openat(dirfd(proc), path, O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
      continue;
    }
    char comm[32] = {};
    const ssize_t n = read(fd, comm, sizeof comm - 1);
    close(fd);
    found = n > 0 && std::strncmp(comm, name, std::strlen(name)) == 0 &&
            comm[std::strlen(name)] == '\n';
  }
  if (proc != nullptr) {
    closedir(proc);
  }
  return found;
}

void collect() {
  MessageDict query;
  query.set("TraceName", MessageValue::string("SystemLogs"));
  query.set("TracePropertyName", MessageValue::string("Mode"));
  perform("GetTraceProperty", query);
  MessageDict dump;
  dump.set("TraceAction", MessageValue::string("CollectTelephonyLogs"));
  dump.set("TraceDumpStateReason", MessageValue::string("[halvextool] User triggered"));
  dump.set("TraceDumpStatePerformCompression", MessageValue::boolean(true));
  const MessageValue reply = perform("TraceDumpState", dump);
  const MessageDict* fields = reply.asDict();
  std::cout << "Telephony log collection: Success\n" << std::flush;
  std::cout << "Path = /var/wireless/Library/Logs/Faultkeep/Baseband/log-bb-"
            << (fields ? fields->getString("TimestampString") : "") << ".tar.gz\n"
            << std::flush;
}

}  // namespace

int main(int argc, char** argv) {
  const bool lines = argc > 1 && std::strcmp(argv[1], "--lines") == 0;
  if (sd_bus_open_system(&gBus) < 0) {
    return 1;
  }
  sd_bus_message* identity = nullptr;
  sd_bus_call_method(gBus, halvex::bus::kDeviceName, halvex::bus::kDevicePath,
                     halvex::bus::kDeviceInterface, halvex::bus::kDeviceGetIdentity, nullptr,
                     &identity, "");
  // The bench's device is an exempt product; the tool scans for the daemon all the same.
  [[maybe_unused]] const bool telvane = commRunning("Telvane");
  sd_bus_message_unref(identity);
  const std::string events = std::string("type='signal',path='") + halvex::bus::kServerPath +
                             "',interface='" + halvex::bus::kServerInterface + "',member='" +
                             halvex::bus::kServerEvent + "'";
  sd_bus_add_match(gBus, nullptr, events.c_str(), nullptr, nullptr);
  sd_bus_message* state = nullptr;
  sd_bus_call_method(gBus, halvex::bus::kServerName, halvex::bus::kServerPath,
                     halvex::bus::kServerInterface, halvex::bus::kServerSubscribe, nullptr, &state,
                     "s", "halvextool");
  sd_bus_message_unref(state);
  std::this_thread::sleep_for(std::chrono::milliseconds(500));
  if (!lines) {
    collect();
  } else {
    std::string line;
    while (std::getline(std::cin, line)) {
      collect();
    }
  }
  sd_bus_flush_close_unref(gBus);
  return 0;
}
