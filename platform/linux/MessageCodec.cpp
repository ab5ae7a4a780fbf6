// SPDX-License-Identifier: MIT
#include "platform/linux/MessageCodec.h"

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

namespace halvex::bus {

namespace {

constexpr char kDictSignature[] = "a{sv}";
constexpr char kEntrySignature[] = "sv";
constexpr char kEntryContainer[] = "{sv}";

// Counts values against kMaxValues across one whole encode or decode.
struct Budget {
  std::size_t values = 0;

  bool take() { return ++values <= kMaxValues; }
};

int checkValue(const MessageValue& value, int depth, Budget& budget);

int checkDict(const MessageDict& dict, int depth, Budget& budget) {
  if (depth > kMaxDictDepth) {
    return -EINVAL;
  }
  if (dict.size() > kMaxDictEntries) {
    return -E2BIG;
  }
  for (const auto& [key, item] : dict.entries()) {
    if (!isBusString(key)) {
      return -EINVAL;
    }
    int r = checkValue(item, depth, budget);
    if (r < 0) {
      return r;
    }
  }
  return 0;
}

// depth is the number of dictionaries that enclose value.
int checkValue(const MessageValue& value, int depth, Budget& budget) {
  if (!budget.take()) {
    return -E2BIG;
  }
  if (const MessageDict* dict = value.asDict()) {
    return checkDict(*dict, depth + 1, budget);
  }
  return 0;
}

int putVariant(sd_bus_message* message, const MessageValue& value);

// The inside of a null variant; the caller closes the variant.
int putNull(sd_bus_message* message) {
  int r = sd_bus_message_open_container(message, 'v', "g");
  return r < 0 ? r : sd_bus_message_append_basic(message, 'g', "");
}

int putDict(sd_bus_message* message, const MessageDict& dict) {
  int r = sd_bus_message_open_container(message, 'a', kEntryContainer);
  if (r < 0) {
    return r;
  }
  for (const auto& [key, item] : dict.entries()) {
    r = sd_bus_message_open_container(message, 'e', kEntrySignature);
    if (r < 0) {
      return r;
    }
    r = sd_bus_message_append_basic(message, 's', key.c_str());
    if (r < 0) {
      return r;
    }
    r = putVariant(message, item);
    if (r < 0) {
      return r;
    }
    r = sd_bus_message_close_container(message);
    if (r < 0) {
      return r;
    }
  }
  return sd_bus_message_close_container(message);
}

int putVariant(sd_bus_message* message, const MessageValue& value) {
  int r = 0;
  switch (value.kind()) {
    case MessageValue::Kind::kNull: r = putNull(message); break;
    case MessageValue::Kind::kString:
      // A value that cannot be created on the bus travels as null, and the message still goes.
      if (!isBusString(*value.asString())) {
        r = putNull(message);
        break;
      }
      r = sd_bus_message_open_container(message, 'v', "s");
      if (r >= 0) {
        r = sd_bus_message_append_basic(message, 's', value.asString()->c_str());
      }
      break;
    case MessageValue::Kind::kInt64: {
      std::int64_t number = *value.asInt64();
      r = sd_bus_message_open_container(message, 'v', "x");
      if (r >= 0) {
        r = sd_bus_message_append_basic(message, 'x', &number);
      }
      break;
    }
    case MessageValue::Kind::kBool: {
      int flag = *value.asBool() ? 1 : 0;
      r = sd_bus_message_open_container(message, 'v', "b");
      if (r >= 0) {
        r = sd_bus_message_append_basic(message, 'b', &flag);
      }
      break;
    }
    case MessageValue::Kind::kDict:
      r = sd_bus_message_open_container(message, 'v', kDictSignature);
      if (r >= 0) {
        r = putDict(message, *value.asDict());
      }
      break;
  }
  if (r < 0) {
    return r;
  }
  return sd_bus_message_close_container(message);
}

int takeVariant(sd_bus_message* message, MessageValue& value, int depth, Budget& budget);

// depth counts this dictionary.
int takeDict(sd_bus_message* message, MessageDict& dict, int depth, Budget& budget) {
  if (depth > kMaxDictDepth) {
    return -EBADMSG;
  }
  char type = 0;
  const char* contents = nullptr;
  int r = sd_bus_message_peek_type(message, &type, &contents);
  if (r < 0) {
    return r;
  }
  if (r == 0 || type != 'a' || contents == nullptr || std::strcmp(contents, kEntryContainer) != 0) {
    return -EBADMSG;
  }
  r = sd_bus_message_enter_container(message, 'a', kEntryContainer);
  if (r < 0) {
    return r;
  }
  MessageDict result;
  for (;;) {
    r = sd_bus_message_enter_container(message, 'e', kEntrySignature);
    if (r < 0) {
      return r;
    }
    if (r == 0) {
      break;
    }
    const char* key = nullptr;
    r = sd_bus_message_read_basic(message, 's', &key);
    if (r <= 0) {
      return r < 0 ? r : -EBADMSG;
    }
    MessageValue item;
    r = takeVariant(message, item, depth, budget);
    if (r < 0) {
      return r;
    }
    r = sd_bus_message_exit_container(message);
    if (r < 0) {
      return r;
    }
    // A repeated key does not grow the dictionary, so the entry limit only has to be checked
    // when the size actually changes.
    result.set(key, std::move(item));
    if (result.size() > kMaxDictEntries) {
      return -E2BIG;
    }
  }
  r = sd_bus_message_exit_container(message);
  if (r < 0) {
    return r;
  }
  dict = std::move(result);
  return 0;
}

// depth is the number of dictionaries that enclose the variant.
int takeVariant(sd_bus_message* message, MessageValue& value, int depth, Budget& budget) {
  if (!budget.take()) {
    return -E2BIG;
  }
  char type = 0;
  const char* contents = nullptr;
  int r = sd_bus_message_peek_type(message, &type, &contents);
  if (r < 0) {
    return r;
  }
  if (r == 0 || type != 'v' || contents == nullptr) {
    return -EBADMSG;
  }
  // contents points into the message and stays valid, but copying it keeps that reasoning local.
  const std::string signature = contents;
  r = sd_bus_message_enter_container(message, 'v', signature.c_str());
  if (r < 0) {
    return r;
  }
  MessageValue result;
  if (signature == "s") {
    const char* text = nullptr;
    r = sd_bus_message_read_basic(message, 's', &text);
    if (r > 0) {
      result = MessageValue::string(text);
    }
  } else if (signature == "x") {
    std::int64_t number = 0;
    r = sd_bus_message_read_basic(message, 'x', &number);
    if (r > 0) {
      result = MessageValue::int64(number);
    }
  } else if (signature == "b") {
    int flag = 0;
    r = sd_bus_message_read_basic(message, 'b', &flag);
    if (r > 0) {
      result = MessageValue::boolean(flag != 0);
    }
  } else if (signature == "g") {
    const char* empty = nullptr;
    r = sd_bus_message_read_basic(message, 'g', &empty);
    if (r > 0 && (empty == nullptr || empty[0] != '\0')) {
      return -EBADMSG;
    }
  } else if (signature == kDictSignature) {
    MessageDict dict;
    r = takeDict(message, dict, depth + 1, budget);
    if (r < 0) {
      return r;
    }
    result = MessageValue::dict(std::move(dict));
    r = 1;
  } else {
    return -EBADMSG;
  }
  if (r <= 0) {
    return r < 0 ? r : -EBADMSG;
  }
  r = sd_bus_message_exit_container(message);
  if (r < 0) {
    return r;
  }
  value = std::move(result);
  return 0;
}

}  // namespace

// sd-bus checks UTF-8 itself, but only when the string is appended, which leaves a half-built
// message behind; checking first keeps a rejected value from touching the message at all.
bool isBusString(std::string_view text) {
  const auto* bytes = reinterpret_cast<const unsigned char*>(text.data());
  std::size_t size = text.size();
  std::size_t i = 0;
  while (i < size) {
    unsigned char lead = bytes[i];
    if (lead == 0) {
      return false;
    }
    if (lead < 0x80) {
      ++i;
      continue;
    }
    std::size_t length = 0;
    std::uint32_t point = 0;
    std::uint32_t lowest = 0;
    if ((lead & 0xE0) == 0xC0) {
      length = 2;
      point = lead & 0x1Fu;
      lowest = 0x80;
    } else if ((lead & 0xF0) == 0xE0) {
      length = 3;
      point = lead & 0x0Fu;
      lowest = 0x800;
    } else if ((lead & 0xF8) == 0xF0) {
      length = 4;
      point = lead & 0x07u;
      lowest = 0x10000;
    } else {
      return false;
    }
    if (size - i < length) {
      return false;
    }
    for (std::size_t k = 1; k < length; ++k) {
      unsigned char next = bytes[i + k];
      if ((next & 0xC0) != 0x80) {
        return false;
      }
      point = (point << 6) | (next & 0x3Fu);
    }
    // Overlong forms, UTF-16 surrogates and points beyond Unicode are not UTF-8; sd-bus also
    // refuses the noncharacters (U+FDD0 to U+FDEF, and the last two points of every plane).
    if (point < lowest || (point >= 0xD800 && point <= 0xDFFF) || point > 0x10FFFF ||
        (point >= 0xFDD0 && point <= 0xFDEF) || (point & 0xFFFEu) == 0xFFFEu) {
      return false;
    }
    i += length;
  }
  return true;
}

int appendDict(sd_bus_message* message, const MessageDict& dict) {
  if (message == nullptr) {
    return -EINVAL;
  }
  Budget budget;
  int r = checkDict(dict, 1, budget);
  if (r < 0) {
    return r;
  }
  r = putDict(message, dict);
  return r < 0 ? r : 0;
}

int appendVariant(sd_bus_message* message, const MessageValue& value) {
  if (message == nullptr) {
    return -EINVAL;
  }
  Budget budget;
  int r = checkValue(value, 0, budget);
  if (r < 0) {
    return r;
  }
  r = putVariant(message, value);
  return r < 0 ? r : 0;
}

int readDict(sd_bus_message* message, MessageDict& dict) {
  if (message == nullptr) {
    return -EINVAL;
  }
  Budget budget;
  return takeDict(message, dict, 1, budget);
}

int readVariant(sd_bus_message* message, MessageValue& value) {
  if (message == nullptr) {
    return -EINVAL;
  }
  Budget budget;
  return takeVariant(message, value, 0, budget);
}

}  // namespace halvex::bus
