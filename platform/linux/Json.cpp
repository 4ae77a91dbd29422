#include "platform/linux/Json.hpp"
