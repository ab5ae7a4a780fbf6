// SPDX-License-Identifier: MIT
// The document reader, built on the parser's events so that what is known only while reading
// comes with its place; the JSON pointers it and the typed reads give; the typed reads.
#include "sim/JsonDocument.h"

#include <cstdio>
#include <optional>
#include <vector>

namespace halvex::sim {
namespace {

std::string escapePointerToken(std::string_view token) {
  std::string out;
  for (const char c : token) {
    if (c == '~') {
      out += "~0";
    } else if (c == '/') {
      out += "~1";
    } else {
      out += c;
    }
  }
  return out;
}

// Control characters (NUL and newline among them, from keys and words the scenario wrote) as
// \u00XX, so that a message stays one printable line.
std::string printable(std::string_view text) {
  std::string out;
  for (const char c : text) {
    if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) {
      char escaped[8];
      std::snprintf(escaped, sizeof escaped, "\\u%04x", static_cast<unsigned char>(c));
      out += escaped;
    } else {
      out += c;
    }
  }
  return out;
}

}  // namespace

ScenarioError::ScenarioError(std::string pointer, std::string problem)
    : std::runtime_error(
          printable((pointer.empty() ? std::string("(top level)") : pointer) + ": " + problem)),
      pointer_(std::move(pointer)),
      problem_(std::move(problem)) {}

namespace json {
namespace {

std::string parseErrorPlace(std::string_view text, std::size_t byte) {
  std::size_t line = 1, column = 1;
  for (std::size_t i = 0; i + 1 < byte && i < text.size(); ++i) {
    if (text[i] == '\n') {
      ++line;
      column = 1;
    } else {
      ++column;
    }
  }
  return "line " + std::to_string(line) + ", column " + std::to_string(column);
}

// What the parser says is wrong, from "[json.exception...] parse error at ...: REASON; last read:
// 'TEXT'". TEXT is raw input (a newline, a byte that is not UTF-8) and stays out of the message.
std::string parseErrorReason(const std::string& what) {
  const std::size_t begin = what.find(": ");
  if (begin == std::string::npos) {
    return {};
  }
  return " (" + what.substr(begin + 2, what.find("; last read") - begin - 2) + ")";
}

// Builds the document from the parser's events rather than letting the library build it, so that
// what is known only while reading comes with a place: where a number overflows, an integer too
// long for 64 bits (which the library would silently turn into a fraction), nesting too deep.
// A place given as a JSON pointer always exists in the document; one in text that turns out not
// to be JSON, or that the library cannot hold, is reported at the top level.
class DocumentReader final : public nlohmann::json_sax<Json> {
 public:
  explicit DocumentReader(std::string_view text) : text_(text) {}
  // The document, once the whole text has been read.
  Json take() {
    if (tooLong_) {
      throw *tooLong_;
    }
    return std::move(document_);
  }

  bool null() override { return add(nullptr); }
  bool boolean(bool value) override { return add(value); }
  bool number_integer(number_integer_t value) override { return add(value); }
  bool number_unsigned(number_unsigned_t value) override { return add(value); }
  bool number_float(number_float_t value, const string_t& text) override {
    // Reported once the rest of the text has proven to be JSON.
    if (text.find_first_of(".eE") == string_t::npos && !tooLong_) {
      tooLong_.emplace(place(), text + " is out of range (beyond 64 bits)");
    }
    return add(value);
  }
  bool string(string_t& value) override { return add(std::move(value)); }
  bool binary(binary_t&) override { return false; }  // JSON text has no binary values
  bool start_object(std::size_t) override { return open(Json::object()); }
  bool key(string_t& key) override {
    open_.back().key = std::move(key);
    return true;
  }
  bool end_object() override { return close(); }
  bool start_array(std::size_t) override { return open(Json::array()); }
  bool end_array() override { return close(); }
  bool parse_error(std::size_t byte, const std::string& token,
                   const nlohmann::detail::exception& error) override {
    const std::string at = parseErrorPlace(text_, byte);
    // 406: a number too large for a double; it is complete, so its place is known.
    if (error.id == 406) {
      fail("", token + " at " + place() + " is out of range (" + at + ")");
    }
    fail("", "not valid JSON at " + at + parseErrorReason(error.what()));
  }

 private:
  struct Open {
    Json* container;
    std::string key;  // of the member being read, in an object
  };

  // The JSON pointer of the value being read. Only the innermost open container grows, so the
  // others' last element is the open one.
  std::string place() const {
    std::string pointer;
    for (std::size_t i = 0; i < open_.size(); ++i) {
      const Open& o = open_[i];
      if (!o.container->is_array()) {
        pointer = child(pointer, o.key);
      } else {
        const std::size_t size = o.container->size();
        pointer += '/';
        pointer += std::to_string(i + 1 == open_.size() ? size : size - 1);
      }
    }
    return pointer;
  }

  // Appending moves only the innermost container's elements, none of which is open: the
  // pointers kept in open_ stay valid.
  Json& insert(Json value) {
    if (open_.empty()) {
      return document_ = std::move(value);
    }
    Json& container = *open_.back().container;
    if (container.is_array()) {
      container.push_back(std::move(value));
      return container.back();
    }
    return container[open_.back().key] = std::move(value);
  }
  bool add(Json value) {
    insert(std::move(value));
    return true;
  }
  bool open(Json container) {
    if (open_.size() >= kMaxDepth) {
      fail("", "nested deeper than " + std::to_string(kMaxDepth) + " levels at " + place());
    }
    open_.push_back({&insert(std::move(container)), {}});
    return true;
  }
  bool close() {
    open_.pop_back();
    return true;
  }

  std::string_view text_;
  Json document_;
  std::vector<Open> open_;
  std::optional<ScenarioError> tooLong_;
};

}  // namespace

Json parse(std::string_view text) {
  DocumentReader reader(text);
  if (!Json::sax_parse(text, &reader)) {
    fail("", "not valid JSON");
  }
  return reader.take();
}

std::string child(const std::string& pointer, std::string_view key) {
  return pointer + "/" + escapePointerToken(key);
}

const char* typeName(const Json& value) {
  switch (value.type()) {
    case Json::value_t::null: return "null";
    case Json::value_t::boolean: return "a boolean";
    case Json::value_t::string: return "a string";
    case Json::value_t::array: return "an array";
    case Json::value_t::object: return "an object";
    case Json::value_t::number_float: return "a fractional number";
    default: return "an integer";
  }
}

[[noreturn]] void fail(const std::string& pointer, const std::string& problem) {
  throw ScenarioError(pointer, problem);
}

[[noreturn]] void expected(const std::string& pointer, const char* what, const Json& got) {
  fail(pointer, std::string("expected ") + what + ", got " + typeName(got));
}

void checkObject(const Json& value, const std::string& pointer,
                 std::initializer_list<std::string_view> allowed) {
  if (!value.is_object()) {
    expected(pointer, "an object", value);
  }
  for (const auto& [key, item] : value.items()) {
    bool known = false;
    for (std::string_view name : allowed) {
      known = known || key == name;
    }
    if (!known) {
      std::string list;
      for (std::string_view name : allowed) {
        list += (list.empty() ? "" : ", ") + std::string(name);
      }
      fail(child(pointer, key), "unknown key (known here: " + list + ")");
    }
  }
}

bool readBool(const Json& value, const std::string& pointer) {
  if (!value.is_boolean()) {
    expected(pointer, "a boolean", value);
  }
  return value.get<bool>();
}

std::string readString(const Json& value, const std::string& pointer) {
  if (!value.is_string()) {
    expected(pointer, "a string", value);
  }
  return value.get<std::string>();
}

}  // namespace json
}  // namespace halvex::sim
