#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "platform/value/EkError.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace ek::ekctl {

// The reply as pretty wire JSON, with a trailing newline.
std::string replyAsJson(const Value& reply);
// The reply as a person reads it on a terminal: a table of plug-ins for "match", the
// plug-in's fields for "find", otherwise one line per reply key ("ok" for an empty reply).
std::string replyAsTable(std::string_view command, const Value& reply);
// The reply as plain JSON (-o json), one shape per command, with a trailing newline: "match"
// and "list" print an array of plug-ins, "find" and "info" one plug-in; an error prints
// {"error": {"code": N, "message": TEXT}}, a reply that carries nothing {"ok": true}, any other
// reply its members. UUIDs, dates and data are text (wirejson::writePlain).
std::string replyAsPlainJson(std::string_view command, const Value& reply);
// A "match" reply keeping only the plug-ins keep accepts.
Result<Value> keepPlugIns(Value reply, const std::function<bool(const Value& form)>& keep);
// A "match" reply made into a "find" reply of the plug-in with this identifier; an error when
// it holds none.
Result<Value> onePlugInNamed(Value reply, const std::string& identifier);
// What the person could do about an error reply to command, when there is something to say;
// executable is the path whose entitlements file the daemon reads.
std::optional<std::string> nextStep(std::string_view command, const EkError& error,
                                    const std::string& executable);
// A --url argument: a URL as given, or an absolute or relative path made into a file URL.
std::string urlArgument(const std::string& text);

}  // namespace ek::ekctl
