// Random (version 4) UUIDs in upper-case 8-4-4-4-12 text.
#pragma once

#include <string>

namespace vtc {

std::string makeUUIDString();

}  // namespace vtc
