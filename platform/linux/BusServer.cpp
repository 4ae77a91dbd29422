#include "platform/linux/BusServer.hpp"
