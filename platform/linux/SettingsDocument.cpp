#include "platform/linux/SettingsDocument.hpp"

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdio>
#include <optional>
#include <utility>

#include "platform/linux/Json.hpp"

namespace platform::linux_ {
namespace {

const std::string checksumEntry = "checksum";
const std::string valuesEntry = "values";

constexpr std::array<std::uint32_t, 256> stepsOfChecksum() {
  std::array<std::uint32_t, 256> steps{};
  for (std::uint32_t byte = 0; byte < steps.size(); ++byte) {
    std::uint32_t sum = byte;
    for (int bit = 0; bit < 8; ++bit) sum = (sum >> 1) ^ ((sum & 1) != 0 ? 0xEDB88320 : 0);
    steps[byte] = sum;
  }
  return steps;
}

// CRC-32 as zlib's: it finds every single flipped bit and every burst of up to 32, which is what a bad disk
// does. Nobody who means harm and can write the file would be held up by a stronger one. It is taken of the
// contents as they print on one line with sorted keys, so that a person may lay the file out anew.
std::string checksumOf(std::string_view canonical) {
  static constexpr auto steps = stepsOfChecksum();
  static_assert(steps[1] == 0x77073096 && steps[255] == 0x2D02EF8D, "zlib's; files that are there hold it");
  std::uint32_t sum = 0xFFFFFFFF;
  for (const char character : canonical)
    sum = (sum >> 8) ^ steps[(sum ^ static_cast<unsigned char>(character)) & 0xFF];
  char text[9];
  std::snprintf(text, sizeof text, "%08x", static_cast<unsigned>(~sum));
  return text;
}

// `problem` with the line on which `entry` stands.
std::error_code refuse(std::string_view text, const std::string& entry, const std::string& what,
                       std::string& problem) {
  const auto before = text.substr(0, text.find('"' + entry + '"'));
  const auto line = 1 + std::count(before.begin(), before.end(), '\n');
  problem = "line " + std::to_string(line) + ": " + what;
  return make_error_code(Outcome::malformedFile);
}

Result<Dictionary> decode(std::string_view text, std::optional<Value>& checksum, std::string& problem) {
  auto parsed = parseJson(text, problem);
  if (!parsed) return parsed.error();
  auto* document = std::get_if<Dictionary>(&parsed->storage);
  if (!document) {
    problem = "line 1, column 1: not an object";
    return Outcome::malformedFile;
  }
  if (const auto found = document->find(checksumEntry); found != document->end()) {
    checksum = std::move(found->second);
    document->erase(found);
  }
  const auto values = document->find(valuesEntry);
  if (values != document->end() && !values->second.as<Dictionary>()) {
    return refuse(text, valuesEntry, "\"values\" is not an object", problem);
  }
  return std::move(*document);
}

}  // namespace

Result<std::string> encodeSettings(const Dictionary& document) {
  const auto canonical = printJson(document, JsonStyle::line);
  if (!canonical) return canonical;
  Dictionary whole = document;
  whole.insert_or_assign(checksumEntry, checksumOf(*canonical));
  return printJson(whole, JsonStyle::indented);
}

Result<Dictionary> decodeSettings(std::string_view text, std::string& problem) {
  std::optional<Value> checksum;
  auto document = decode(text, checksum, problem);
  if (!document || !checksum) return document;
  const auto canonical = printJson(*document, JsonStyle::line);
  if (canonical && *checksum == Value(checksumOf(*canonical))) return document;
  return refuse(text, checksumEntry, "the contents do not match their checksum", problem);
}

Result<Dictionary> decodeEditedSettings(std::string_view text, std::string& problem) {
  std::optional<Value> ignored;
  return decode(text, ignored, problem);
}

const Dictionary& settingsValues(const Dictionary& document) {
  static const Dictionary none;
  const auto* values = find<Dictionary>(document, valuesEntry);
  return values ? *values : none;
}

Dictionary& settingsValues(Dictionary& document) {
  Value& entry = document[valuesEntry];
  if (!entry.as<Dictionary>()) entry = Dictionary{};
  return std::get<Dictionary>(entry.storage);
}

bool sameValue(const Value& a, const Value& b) {
  if (a == b) return true;
  const auto textOfA = printJson(a, JsonStyle::line);
  const auto textOfB = printJson(b, JsonStyle::line);
  return textOfA && textOfB && *textOfA == *textOfB;
}

std::vector<std::string> differingKeys(const Dictionary& a, const Dictionary& b) {
  std::vector<std::string> keys;
  for (const auto& [key, value] : a) {
    const auto other = b.find(key);
    if (other == b.end() || !sameValue(value, other->second)) keys.push_back(key);
  }
  for (const auto& [key, value] : b) {
    if (!a.contains(key)) keys.push_back(key);
  }
  std::sort(keys.begin(), keys.end());
  return keys;
}

namespace {

void carryOverEntries(const Dictionary& before, const Dictionary& after, Dictionary& into) {
  for (const std::string& key : differingKeys(before, after)) {
    if (const auto found = after.find(key); found != after.end()) {
      into.insert_or_assign(key, found->second);
    } else {
      into.erase(key);
    }
  }
}

}  // namespace

void carryOver(const Dictionary& before, const Dictionary& after, Dictionary& into) {
  Dictionary values = settingsValues(std::as_const(into));
  carryOverEntries(settingsValues(before), settingsValues(after), values);
  carryOverEntries(before, after, into);
  if (into.contains(valuesEntry)) into[valuesEntry] = std::move(values);
}

}  // namespace platform::linux_
