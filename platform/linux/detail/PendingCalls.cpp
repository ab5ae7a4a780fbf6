// SPDX-License-Identifier: MIT
#include "detail/PendingCalls.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <utility>

#include "detail/BusSupport.h"

namespace halvex::bus {

std::string LoggedOutcome::describe() const {
  // By hand rather than with snprintf: this runs for every request.
  char hex[8];
  const char* const hexEnd =
      std::to_chars(hex, hex + sizeof hex, static_cast<std::uint32_t>(result.code), 16).ptr;
  std::string text = label;
  text += ": code 0x";
  text.append(sizeof hex - static_cast<std::size_t>(hexEnd - hex), '0');
  for (const char* c = hex; c != hexEnd; ++c) {
    text += static_cast<char>(std::toupper(static_cast<unsigned char>(*c)));
  }
  text += " in ";
  text += std::to_string(tookUsec / 1000);
  const std::uint64_t fraction = tookUsec % 1000;
  text += fraction < 10 ? ".00" : fraction < 100 ? ".0" : ".";
  text += std::to_string(fraction);
  text += " ms";
  if (!result.message.empty()) {
    text += ": ";
    text += result.message;
  }
  return text;
}

LogOutbox::LogOutbox(std::shared_ptr<LogServer> server) : server_(std::move(server)) {}

void LogOutbox::add(LoggedOutcome entry) {
  MutexLock lock(mutex_);
  entries_.push_back(std::move(entry));
  waiting_.store(true, std::memory_order_release);
}

void LogOutbox::flush() {
  if (!waiting_.load(std::memory_order_acquire)) {
    return;
  }
  MutexLock writer(writing_);
  {
    // Swapped with the batch emptied last time, so that neither side allocates anew.
    MutexLock lock(mutex_);
    batch_.swap(entries_);
    waiting_.store(false, std::memory_order_relaxed);
  }
  for (const LoggedOutcome& entry : batch_) {
    server_->write(LogContext(kLogSubsystem, entry.category),
                   entry.result.ok() ? LogLevel::kDebug : LogLevel::kWarning, entry.describe());
  }
  batch_.clear();
}

PendingCalls::~PendingCalls() {
  for (auto& [id, call] : calls_) {
    sd_bus_slot_unref(call->slot);
  }
}

std::unique_ptr<PendingCalls::Call> PendingCalls::start(std::chrono::microseconds bound,
                                                        const char* category, std::string label,
                                                        ReplyHandler done, const void* owner) {
  auto call = std::make_unique<Call>();
  call->started = clock_();
  call->deadline = call->started + static_cast<std::uint64_t>(bound.count());
  call->owner = owner;
  call->category = category;
  call->label = std::move(label);
  call->done = std::move(done);
  return call;
}

void PendingCalls::insert(std::unique_ptr<Call> call) {
  call->id = ++nextId_;
  const std::uint64_t id = call->id;
  calls_.emplace(id, std::move(call));
}

std::unique_ptr<PendingCalls::Call> PendingCalls::take(std::uint64_t id) {
  auto node = calls_.extract(id);
  if (node.empty()) {
    return nullptr;
  }
  std::unique_ptr<Call> call = std::move(node.mapped());
  // Inside its own reply callback sd-bus holds a reference of its own to the slot.
  call->slot = sd_bus_slot_unref(call->slot);
  return call;
}

void PendingCalls::finish(std::unique_ptr<Call> call, const Result& failure,
                          sd_bus_message* reply) {
  Result outcome = call->done(failure, reply);
  // Released before the log entry is queued: what the handler holds may have to go first.
  call->done = nullptr;
  if (call->category != nullptr) {
    log_.add(
        {call->category, std::move(call->label), std::move(outcome), clock_() - call->started});
  }
}

template <typename Pred, typename Why>
void PendingCalls::finishIf(Pred pred, Why why) {
  std::vector<std::unique_ptr<Call>> taken;
  for (auto it = calls_.begin(); it != calls_.end();) {
    if (pred(*it->second)) {
      it->second->slot = sd_bus_slot_unref(it->second->slot);
      taken.push_back(std::move(it->second));
      it = calls_.erase(it);
    } else {
      ++it;
    }
  }
  // Finished once out of the table: a handler may start calls of its own.
  for (auto& call : taken) {
    const Result result = why(*call);
    finish(std::move(call), result, nullptr);
  }
}

void PendingCalls::expire() {
  const std::uint64_t now = clock_();
  finishIf([now](const Call& call) { return call.deadline <= now; },
           [](const Call& call) {
             const std::uint64_t bound = call.deadline - call.started;
             return makeResult(kResultTimeout,
                               "no answer within " + std::to_string(bound / 1000) + " ms");
           });
}

void PendingCalls::finishOwned(const void* owner, const Result& why) {
  finishIf([owner](const Call& call) { return call.owner == owner; },
           [&why](const Call&) { return why; });
}

void PendingCalls::finishAll(const Result& why) {
  finishIf([](const Call&) { return true; }, [&why](const Call&) { return why; });
}

std::uint64_t PendingCalls::earliestDeadline() const {
  std::uint64_t earliest = UINT64_MAX;
  for (const auto& [id, call] : calls_) {
    earliest = std::min(earliest, call->deadline);
  }
  return earliest;
}

}  // namespace halvex::bus
