#pragma once

#include <string>
#include <string_view>

#include "platform/value/Value.h"

namespace ek::ekctl {

// The reply as pretty wire JSON, with a trailing newline.
std::string replyAsJson(const Value& reply);
// The reply as a person reads it on a terminal: a table of plug-ins for "match", the
// plug-in's fields for "find", otherwise one line per reply key ("ok" for an empty reply).
std::string replyAsTable(std::string_view command, const Value& reply);
// A --url argument: a URL as given, or an absolute or relative path made into a file URL.
std::string urlArgument(const std::string& text);

}  // namespace ek::ekctl
