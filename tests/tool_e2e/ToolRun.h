// SPDX-License-Identifier: MIT
// Running the real halvextool in the end-to-end tests.
#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <functional>
#include <iterator>
#include <nlohmann/json.hpp>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "tests/support/Subprocess.h"
#include "tests/support/TestBus.h"

namespace halvex::e2e {

using namespace std::chrono_literals;

inline const std::string kPrompt = "(/halvextool)>> ";
inline const std::string kRefusal = "Server is not running. Please try after server starts.\n";
inline const std::string kSnapshot = "/var/wireless/Library/Logs/Faultkeep/Baseband/log-bb-";

// A device that needs neither daemon, so these tests do not depend on which processes run.
inline const std::string kExemptDevice = R"("device": {"product_type": 58})";

// One-shot with words, or interactive when words is empty, feeding input and closing it.
inline test::RunResult runTool(std::vector<std::string> words, std::string input = {}) {
  test::RunOptions options;
  options.args = {HALVEXTOOL_BINARY};
  options.args.insert(options.args.end(), words.begin(), words.end());
  options.input = std::move(input);
  options.timeout = 30s;
  return test::runProcess(options);
}

// An interactive tool whose input the test writes piece by piece, reacting to what it prints.
class InteractiveTool {
 public:
  InteractiveTool() {
    // A tool that died early must fail the test through write(), not kill it with SIGPIPE.
    ::signal(SIGPIPE, SIG_IGN);
    int in[2];
    if (::pipe2(in, O_CLOEXEC) != 0) {
      throw std::runtime_error("pipe2 failed");
    }
    const int out = ::open(outPath().c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    const int err = ::open(errPath().c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    pid_ = test::spawnChild({HALVEXTOOL_BINARY}, {}, {{in[0], 0}, {out, 1}, {err, 2}});
    ::close(in[0]);
    ::close(out);
    ::close(err);
    input_ = in[1];
  }
  ~InteractiveTool() {
    closeInput();
    if (pid_ > 0) {
      ::kill(pid_, SIGKILL);
      test::waitChild(pid_, 5s);
    }
  }
  InteractiveTool(const InteractiveTool&) = delete;
  InteractiveTool& operator=(const InteractiveTool&) = delete;

  void send(const std::string& text) {
    ASSERT_EQ(::write(input_, text.data(), text.size()), static_cast<ssize_t>(text.size()));
  }
  void closeInput() {
    if (input_ >= 0) {
      ::close(input_);
      input_ = -1;
    }
  }

  std::string out() const { return readAll(outPath()); }
  std::string err() const { return readAll(errPath()); }

  // Polls until done(out, err) holds; false after the time-out.
  bool waitUntil(const std::function<bool(const std::string&, const std::string&)>& done,
                 std::chrono::milliseconds timeout = 10s) const {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
      if (done(out(), err())) {
        return true;
      }
      std::this_thread::sleep_for(10ms);
    }
    return done(out(), err());
  }

  test::ExitStatus finish(std::chrono::milliseconds timeout = 10s) {
    closeInput();
    const test::ExitStatus status = test::waitChild(pid_, timeout);
    pid_ = -1;
    return status;
  }

 private:
  std::string outPath() const { return (dir_.path() / "out").string(); }
  std::string errPath() const { return (dir_.path() / "err").string(); }
  static std::string readAll(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
  }

  test::TempDir dir_;
  pid_t pid_ = -1;
  int input_ = -1;
};

inline std::size_t occurrences(const std::string& text, const std::string& part) {
  std::size_t count = 0;
  for (auto at = text.find(part); at != std::string::npos; at = text.find(part, at + 1)) {
    ++count;
  }
  return count;
}

// The server and helper requests of the request log, without the bus plumbing (subscriptions)
// and the device identity queries.
inline std::vector<nlohmann::json> commandRequests(const test::SimProcess& sim) {
  std::vector<nlohmann::json> requests;
  for (const nlohmann::json& entry : sim.requestLog()) {
    if (entry.value("service", "") != "device" && entry.value("method", "") != "Subscribe") {
      requests.push_back(entry);
    }
  }
  return requests;
}

inline nlohmann::json key(const std::string& name, const std::string& value) {
  return {{"key", name}, {"type", "string"}, {"value", value}};
}

// Without it a string literal would pick the bool overload.
inline nlohmann::json key(const std::string& name, const char* value) {
  return key(name, std::string(value));
}

inline nlohmann::json key(const std::string& name, bool value) {
  return {{"key", name}, {"type", "bool"}, {"value", value}};
}

inline nlohmann::json serverRequest(const std::string& command, nlohmann::json keys) {
  return {{"service", "server"},
          {"method", "PerformCommand"},
          {"client", "halvextool"},
          {"command", command},
          {"keys", std::move(keys)}};
}

inline nlohmann::json modeQuery() {
  return serverRequest("GetTraceProperty",
                       {key("TraceName", "SystemLogs"), key("TracePropertyName", "Mode")});
}

}  // namespace halvex::e2e
