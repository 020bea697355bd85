#pragma once

#include <string_view>

#include "platform/value/Value.h"

// The SDK merge, apart from the registry so that the plug-in record of the client library can
// use the same one without the registry's database.
namespace ek::vantor {

inline constexpr std::string_view kSharedKey = "Shared";
inline constexpr std::string_view kCleanTimeoutKey = "CleanTimeout";

// The SDK merge, the one both the registry and the plug-in record use: a copy of info with
// sdk merged in at every depth. A key only the SDK has is copied whole; "CleanTimeout" takes
// the SDK's value; "Shared" lists are united (mergeSharedLists); dictionaries on both sides
// are merged key by key; for every other key the plug-in's own value wins.
Dictionary mergeSdk(const Dictionary& sdk, const Dictionary& info);
// The one key whose SDK value replaces the plug-in's own.
bool sdkOverridesKey(std::string_view key);
// The union of two "Shared" lists (a string counts as a one-element list; either may be
// null), sorted and without duplicates. Only strings are paths: other elements are dropped.
Array mergeSharedLists(const Value* sdkList, const Value* plugInList);

}  // namespace ek::vantor
