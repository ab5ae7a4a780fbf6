// SPDX-License-Identifier: MIT
// The shell over the tool's real command tree on the fake platform. Two header bytes set the
// scene (whether the server has started, how it and the helper answer, interactive or one-shot
// mode); the rest is what the user types, or the words of a one-shot command line. Besides
// never crashing, hanging or leaking, the run must account for what it did: one prompt per line
// read, one result line per collection the server was asked for, a path only after a success,
// a reason the server can tell apart, and nothing on standard error but the refusal.
#include <algorithm>
#include <cstdint>
#include <memory>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

#include "Tools/HalvexTool/DumpOptions.h"
#include "Tools/HalvexTool/HalvexCommand.h"
#include "Tools/HalvexTool/LogdumpCommand.h"
#include "Tools/HalvexTool/ServerState.h"
#include "fuzz/FuzzSupport.h"
#include "platform/ServerClient.h"
#include "platform/ServerProtocol.h"
#include "platform/TaskGroup.h"
#include "platform/WorkQueue.h"
#include "platform/fake/FakePlatform.h"
#include "shell/CommandShell.h"
#include "shell/Console.h"

namespace halvex::fuzz {
namespace {

using fake::Answer;
using fake::FakePlatform;

// One session for the whole process, as the tool has: the fake keeps every manager it made.
struct Session {
  WorkQueue queue = WorkQueue::create("halvextool.queue");
  std::shared_ptr<client::Manager> manager = client::CreateManager("halvextool", queue);
};

Session& session() {
  static auto* const instance = new Session();
  return *instance;
}

// HalvexShell without the wait for the first state event: the flag is set before each run.
class FuzzShell final : public CommandShell {
 protected:
  std::shared_ptr<CommandBase> createRootCommand() override {
    return HalvexCommand::create("halvextool", {}, session().manager, session().queue);
  }
};

MessageValue dictWith(const char* key, MessageValue value) {
  MessageDict dict;
  dict.set(key, std::move(value));
  return MessageValue::dict(std::move(dict));
}

Answer ok(MessageValue reply) {
  return {Result{0, ""}, std::move(reply)};
}

Answer failed(std::int32_t code) {
  return {Result{code, "failed"}, {}};
}

Answer property(const char* text) {
  return ok(dictWith(kKeyTracePropertyValue, MessageValue::string(text)));
}

// Time stamps stay plain so that the output cannot imitate a prompt.
Answer dumpAnswer(unsigned choice) {
  switch (choice) {
    case 0: return ok(dictWith(kKeyTimestampString, MessageValue::string("T1")));
    case 1: return ok(MessageValue::dict({}));
    case 2: return ok(MessageValue::null());
    case 3: return failed(kResultServerNotRunning);
    case 4: return failed(kResultTimeout);
    case 5: return ok(MessageValue::string("T2"));
    default: return ok(dictWith(kKeyTimestampString, MessageValue::int64(7)));
  }
}

struct Scene {
  bool started;
  bool oneShot;
  bool internalBuild;  // consults the helper when the server is down
  bool helperCreatable;
  Answer enabled;
  Answer mode;
  Answer dump;
  Answer helper;
};

Scene readScene(FuzzInput& in) {
  const std::uint8_t setup = in.byte();
  const std::uint8_t answers = in.byte();
  const Answer enabled[] = {property("1"), property("true"), property("0"), failed(kResultTimeout)};
  const Answer modes[] = {property("0"), property("3"), property("0x3"),
                          ok(MessageValue::string("3"))};
  return Scene{(setup & 1) != 0,
               (setup & 2) != 0,
               (setup & 4) != 0,
               (setup & 8) != 0,
               enabled[answers & 3],
               modes[(answers >> 2) & 3],
               dumpAnswer((answers >> 4) & 7),
               (answers & 0x80) != 0 ? ok(dictWith(kKeyTimestampString, MessageValue::string("H1")))
                                     : failed(kResultTimeout)};
}

void install(const Scene& scene) {
  FakePlatform& platform = FakePlatform::get();
  fake::Device device;
  device.internalBuild = scene.internalBuild;
  platform.setDevice(device);
  platform.setHelperCreatable(scene.helperCreatable);
  platform.setServerResponder([scene](const std::string& command, const MessageDict& request) {
    if (command != kCommandGetTraceProperty) {
      return scene.dump;
    }
    return request.getString(kKeyTraceName) == kTraceBaseband ? scene.enabled : scene.mode;
  });
  platform.setHelperResponder(
      [scene](helper::TaskID, const std::string&, const MessageDict&) { return scene.helper; });
  onServerStateChange(
      dictWith(kKeyServerState,
               MessageValue::string(scene.started ? kServerStateStarted : "Stopped")),
      TaskGroup());
  platform.clearCalls();
  platform.clearRequests();
}

// Removes the prompts from out and returns how many there were.
std::size_t takePrompts(std::string& out) {
  std::size_t count = 0;
  for (const std::string_view prompt : {"(/halvextool)>> ", "(/halvextool/logdump)>> "}) {
    for (std::size_t at = out.find(prompt); at != std::string::npos; at = out.find(prompt, at)) {
      out.erase(at, prompt.size());
      ++count;
    }
  }
  return count;
}

std::size_t countStarting(const std::vector<std::string>& lines, std::string_view prefix) {
  std::size_t count = 0;
  for (const std::string& line : lines) {
    count += line.starts_with(prefix) ? 1 : 0;
  }
  return count;
}

void checkRequests(const Scene& scene, const std::vector<std::string>& lines) {
  std::size_t telephony = 0;
  std::size_t coredump = 0;
  std::size_t basebandQueries = 0;
  for (const fake::ServerRequest& request : FakePlatform::get().serverRequests()) {
    const std::string action = request.request.getString(kKeyTraceAction);
    telephony += request.asynchronous && action == kCollectTelephonyLogs ? 1 : 0;
    coredump += request.asynchronous && action == kCollectTelephonyLogsWithCoredump ? 1 : 0;
    if (request.command == kCommandGetTraceProperty) {
      basebandQueries += request.request.getString(kKeyTraceName) == kTraceBaseband ? 1 : 0;
      continue;
    }
    check(request.command == kCommandTraceDumpState, "only the two commands go to the server",
          [&] { return request.command; });
    const std::string reason = request.request.getString(kKeyTraceDumpStateReason) +
                               request.request.getString(kKeyBasebandResetReason);
    check(reason.starts_with(kReasonPrefix), "every dump carries the tool's reason", reason);
  }
  check(scene.started || telephony + coredump == 0,
        "nothing is collected before the server starts");
  check(countStarting(lines, "Telephony log collection: ") == telephony,
        "one result line per telephony collection");
  check(countStarting(lines, "Telephony log collection with Coredump: ") == coredump,
        "one result line per core-dump collection");
  check(countStarting(lines, "Baseband log collection: ") +
                countStarting(lines, "Baseband logs are not enabled") ==
            basebandQueries,
        "one result line per baseband collection");
  for (std::size_t i = 0; i < lines.size(); ++i) {
    if (lines[i].starts_with("Path = ")) {
      check(i > 0 && lines[i - 1].find(" collection") != std::string::npos &&
                lines[i - 1].find(": Success") != std::string::npos,
            "a path follows its collection's success", [&] { return lines[i]; });
    }
  }
}

}  // namespace
}  // namespace halvex::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace halvex;
  using namespace halvex::fuzz;
  FuzzInput in(data, size);
  const Scene scene = readScene(in);
  install(scene);
  const std::string typed = in.rest();

  std::vector<std::string> arguments = {"halvextool"};
  if (scene.oneShot) {
    // Process arguments may hold any byte but NUL, blanks included.
    for (std::string& word : split(typed, '\n')) {
      if (word.find('\0') == std::string::npos) {
        arguments.push_back(std::move(word));
      }
    }
  }
  std::istringstream input(scene.oneShot ? std::string() : typed);
  std::ostringstream out;
  std::ostringstream err;
  bool quit = false;
  {
    ScopedConsoleForTesting console(input, out, err);
    FuzzShell shell;
    quit = shell.run(arguments);
  }

  const std::string refusal = std::string(kServerNotRunningMessage) + "\n";
  const std::string errText = err.str();
  for (std::size_t at = 0; at < errText.size(); at += refusal.size()) {
    check(!scene.started && errText.compare(at, refusal.size(), refusal) == 0,
          "standard error holds only the refusal, and only before the server starts", errText);
  }

  std::string outText = out.str();
  const std::size_t prompts = takePrompts(outText);
  if (!scene.oneShot) {
    // As getline counts: a last line without its newline still counts.
    const std::size_t lines = split(typed, '\n').size();
    if (quit) {
      check(prompts >= 1 && prompts <= lines, "a quit is read at a prompt");
    } else {
      check(prompts == lines + 1, "one prompt per line read, and one that meets the end", [&] {
        return std::to_string(prompts) + " prompts for " + std::to_string(lines) + " lines";
      });
    }
  }
  checkRequests(scene, split(outText, '\n'));
  return 0;
}
