// SPDX-License-Identifier: MIT
// The system log: a context names where messages come from (a reverse-domain subsystem and a
// category); a server writes them; a logger binds a context to a server.
#pragma once

#include <memory>
#include <string>
#include <string_view>

namespace halvex {

class LogContext {
 public:
  LogContext(std::string subsystem, std::string category)
      : subsystem_(std::move(subsystem)), category_(std::move(category)) {}

  const std::string& subsystem() const { return subsystem_; }
  const std::string& category() const { return category_; }

 private:
  std::string subsystem_;
  std::string category_;
};

enum class LogLevel { kDebug, kInfo, kNotice, kWarning, kError };

class LogServer {
 public:
  virtual ~LogServer() = default;

  // The backend's server. Never null.
  static std::shared_ptr<LogServer> create();

  // Thread-safe.
  virtual void write(const LogContext& context, LogLevel level, std::string_view message) = 0;
};

// A context bound to a server. A logger without a server drops what it is given.
class Logger {
 public:
  Logger() = default;
  Logger(LogContext context, std::shared_ptr<LogServer> server)
      : context_(std::move(context)), server_(std::move(server)) {}

  bool isBound() const { return server_ != nullptr; }
  const std::shared_ptr<LogServer>& server() const { return server_; }
  const LogContext& context() const { return context_; }

  void log(LogLevel level, std::string_view message) const {
    if (server_) {
      server_->write(context_, level, message);
    }
  }

 private:
  LogContext context_{"", ""};
  std::shared_ptr<LogServer> server_;
};

}  // namespace halvex
