// Whether what a root holds is sound.
#pragma once

#include "platform/linux/FileSystem.hpp"
#include "platform/linux/Paths.hpp"
#include "tools/Output.hpp"
#include "tools/hearthctl/Hearth.hpp"

namespace tools {

// Whether the stores and the alarms agree, and the remedy where they do not. Changes nothing.
Exit check(Output& output, const platform::linux_::Paths& paths, platform::linux_::FileSystem& files,
           Hearth& hearth);

}  // namespace tools
