// SPDX-License-Identifier: MIT
// A problem in a scenario, where and what, as the JSON reads (JsonDocument.h) and the scenario's
// rules report it. Light on purpose: everything that includes Scenario.h sees it.
#pragma once

#include <stdexcept>
#include <string>

namespace halvex::sim {

// Where: a JSON pointer, "" for the whole document. what() is "POINTER: PROBLEM" ("(top level)"
// for ""), one printable line.
class ScenarioError : public std::runtime_error {
 public:
  ScenarioError(std::string pointer, std::string problem);
  const std::string& pointer() const { return pointer_; }
  const std::string& problem() const { return problem_; }

 private:
  std::string pointer_;
  std::string problem_;
};

}  // namespace halvex::sim
