// SPDX-License-Identifier: MIT
#include "sim/RequestLog.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>

namespace halvex::sim {
namespace {

nlohmann::ordered_json describeValue(const MessageValue& value) {
  if (const auto* text = value.asString()) {
    return {{"type", "string"}, {"value", *text}};
  }
  if (const auto* number = value.asInt64()) {
    return {{"type", "int64"}, {"value", *number}};
  }
  if (const auto* flag = value.asBool()) {
    return {{"type", "bool"}, {"value", *flag}};
  }
  if (const auto* dict = value.asDict()) {
    return {{"type", "dict"}, {"value", describeKeys(*dict)}};
  }
  return {{"type", "null"}, {"value", nullptr}};
}

}  // namespace

nlohmann::ordered_json describeKeys(const MessageDict& dict) {
  auto keys = nlohmann::ordered_json::array();
  for (const auto& [key, value] : dict.entries()) {
    nlohmann::ordered_json entry = {{"key", key}};
    entry.update(describeValue(value));
    keys.push_back(std::move(entry));
  }
  return keys;
}

RequestLog::RequestLog(const std::string& path) {
  if (path.empty()) {
    return;
  }
  fd_ = ::open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
  if (fd_ < 0) {
    throw std::system_error(errno, std::generic_category(), path + ": cannot open the request log");
  }
}

RequestLog::~RequestLog() {
  if (fd_ >= 0) {
    ::close(fd_);
  }
}

void RequestLog::write(const nlohmann::ordered_json& entry) {
  if (fd_ < 0) {
    return;
  }
  // Keys come off the bus as checked UTF-8, but replace rather than throw if one ever is not.
  std::string line = entry.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
  line += '\n';
  // One write per line with O_APPEND: a reader never sees half a line from us.
  std::size_t done = 0;
  while (done < line.size()) {
    const ssize_t n = ::write(fd_, line.data() + done, line.size() - done);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      return;
    }
    done += static_cast<std::size_t>(n);
  }
}

}  // namespace halvex::sim
