#include "platform/vantor/SdkMerge.h"

#include <set>
#include <string>

namespace ek::vantor {

Dictionary mergeSdk(const Dictionary& sdk, const Dictionary& info) {
  Dictionary merged = info;
  for (const auto& [key, sdkValue] : sdk) {
    auto it = merged.find(key);
    if (it == merged.end()) {
      merged.emplace(key, sdkValue);
    } else if (sdkOverridesKey(key)) {
      it->second = sdkValue;
    } else if (key == kSharedKey) {
      it->second = Value(mergeSharedLists(&sdkValue, &it->second));
    } else if (const Dictionary* sdkDictionary = sdkValue.dictionary()) {
      if (const Dictionary* own = it->second.dictionary()) {
        it->second = Value(mergeSdk(*sdkDictionary, *own));
      }
    }
  }
  return merged;
}

bool sdkOverridesKey(std::string_view key) {
  return key == kCleanTimeoutKey;
}

Array mergeSharedLists(const Value* sdkList, const Value* plugInList) {
  std::set<std::string, std::less<>> paths;
  for (const Value* list : {sdkList, plugInList}) {
    if (list == nullptr) continue;
    if (const std::string* single = list->string()) {
      paths.insert(*single);
    } else if (const Array* many = list->array()) {
      for (const Value& element : *many) {
        if (const std::string* path = element.string()) paths.insert(*path);
      }
    }
  }
  return Array(paths.begin(), paths.end());
}

}  // namespace ek::vantor
