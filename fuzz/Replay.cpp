// Gives every file that its arguments name, or that is in a folder of them, to a target; where no libFuzzer
// does.
#include <cstdio>
#include <filesystem>
#include <string>

#include "fuzz/Target.hpp"
#include "tests/fakes/RealFiles.hpp"

namespace {

int replay(const std::filesystem::path& path) {
  int replayed = 0;
  if (std::filesystem::is_directory(path)) {
    for (const auto& entry : std::filesystem::directory_iterator(path)) replayed += replay(entry.path());
    return replayed;
  }
  const std::string bytes = fakes::contents(path);
  LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size());
  return 1;
}

}  // namespace

int main(int count, char** paths) {
  int replayed = 0;
  for (int index = 1; index < count; ++index) replayed += replay(paths[index]);
  std::printf("%d inputs\n", replayed);
  return replayed > 0 ? 0 : 1;
}
