#include "platform/linux/PeerIdentity.hpp"
