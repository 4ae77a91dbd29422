// Gives every file of the folders that are its arguments to a target; where no libFuzzer does.
#include "fuzz/Target.hpp"
#include "tests/fakes/RealFiles.hpp"

int main(int count, char** folders) {
  int replayed = 0;
  for (int index = 1; index < count; ++index) {
    for (const auto& entry : std::filesystem::directory_iterator(folders[index])) {
      const std::string bytes = fakes::contents(entry.path());
      LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size());
      ++replayed;
    }
  }
  std::printf("%d inputs\n", replayed);
  return replayed > 0 ? 0 : 1;
}
