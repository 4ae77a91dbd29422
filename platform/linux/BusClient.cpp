#include "platform/linux/BusClient.hpp"
