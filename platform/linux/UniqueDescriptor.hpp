// A file descriptor that is closed with its owner.
#pragma once

#include <unistd.h>

#include <cerrno>
#include <system_error>
#include <utility>

namespace platform::linux_ {

// What the last system call of this thread failed with.
inline std::error_code lastError() { return {errno, std::system_category()}; }

class UniqueDescriptor {
 public:
  UniqueDescriptor() = default;
  explicit UniqueDescriptor(int descriptor_) : descriptor(descriptor_) {}
  UniqueDescriptor(UniqueDescriptor&& other) noexcept : descriptor(other.release()) {}
  UniqueDescriptor& operator=(UniqueDescriptor&& other) noexcept {
    if (this != &other) reset(other.release());
    return *this;
  }
  ~UniqueDescriptor() { reset(); }

  int get() const { return descriptor; }
  explicit operator bool() const { return descriptor >= 0; }
  int release() { return std::exchange(descriptor, -1); }
  void reset(int next = -1) {
    if (descriptor >= 0) ::close(descriptor);
    descriptor = next;
  }

 private:
  int descriptor = -1;
};

// The call again when a signal cut it short.
template <class Call>
auto retried(Call call) {
  auto result = call();
  while (result < 0 && errno == EINTR) result = call();
  return result;
}

}  // namespace platform::linux_
