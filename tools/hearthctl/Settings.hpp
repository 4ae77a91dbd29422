// The three stores as an operator reads and writes them: on the files, whether the daemon runs or not.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "pairwelld/settings/KeyValueSource.hpp"
#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/FileSystem.hpp"
#include "platform/linux/Paths.hpp"
#include "tools/Output.hpp"
#include "tools/hearthctl/Hearth.hpp"

namespace tools {

// What a text means as "bool", "int", "double" or "string", or, without a type, as the first of them that it
// is. Absent where it is none.
std::optional<platform::Value> valueFromText(const std::string& text, const std::string& type);

// One JSON object; `problem` as parseJson().
platform::Result<platform::Dictionary> parseObject(std::string_view text, std::string& problem);

class Settings {
 public:
  // All but `source` outlive the object.
  Settings(const platform::linux_::Paths& paths, pairwell::KeyValueSource source,
           platform::linux_::FileSystem& files, Hearth& hearth);

  // The keys and their values; none where there is no file. A damaged file is left where it is, and `problem`
  // says what is wrong with it.
  platform::Result<platform::Dictionary> values(std::string& problem) const;

  // The commands; each prints, and answers how to exit.
  Exit list(Output& output) const;
  Exit get(Output& output, const std::string& key) const;
  // No value removes the key.
  Exit set(const std::string& key, const std::optional<platform::Value>& value);
  Exit edit();

 private:
  Exit takeEdited(const std::string& copy, const std::string& text,
                  const platform::Result<platform::Dictionary>& before);
  Exit finish(const platform::Result<void>& written);
  platform::Result<void> write(const std::string& key, const std::optional<platform::Value>& value);
  // Makes the changes that lead from `before` to `after`, and leaves alone what others changed meanwhile.
  platform::Result<void> install(const platform::Dictionary& before, const platform::Dictionary& after);
  platform::Result<void> installWhole(const platform::Dictionary& document);

  const platform::linux_::Paths& paths;
  const pairwell::KeyValueSource source;
  const std::string path;
  platform::linux_::FileSystem& files;
  Hearth& hearth;
};

}  // namespace tools
