// String operations of the server layout and the lock owner text.
#pragma once

#include <string>
#include <string_view>

#include "VantorSyncManager/Export.h"

// The receiver, "/" and the component, with no normalisation: a component
// that begins with "/" gives a double slash, an empty one a trailing "/".
VSM_EXPORT std::string stringByAppendingTesselPathComponent(std::string_view path,
                                                            std::string_view component);

// The string with "&", "<", ">" and the double quote replaced by their XML
// entities (ampersand first); the apostrophe is left as it is.
VSM_EXPORT std::string stringByXMLQuoting(std::string_view text);
