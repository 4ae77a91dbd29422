#include "platform/linux/FileSystem.hpp"
