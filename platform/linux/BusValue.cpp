#include "platform/linux/BusValue.hpp"
