#pragma once

#include <memory>
#include <optional>
#include <string_view>

#include "platform/prefs/Preferences.h"
#include "platform/value/Value.h"

namespace ek {

// The one user preference the daemon honours: the global exclusions, attribute rules that
// remove matching plug-ins from every discovery result.
//
// Thread-safe; nothing is cached, each call reads the preference afresh.
class EkDUserPrefs {
 public:
  static constexpr std::string_view kDomain = "com.corvane.ekora.userprefs";
  static constexpr std::string_view kExclusionsKey = "exclusions";

  // Reads through preferences; null means the domain files of the daemon's own user.
  static std::shared_ptr<EkDUserPrefs> init(
      std::shared_ptr<prefs::Preferences> preferences = nullptr);

  // Synchronises the domain so values another process wrote are seen, and answers
  // "exclusions" as stored, whatever its type; nothing when the domain or key is missing (or
  // the domain file is unreadable).
  std::optional<Value> exclusions();

 private:
  explicit EkDUserPrefs(std::shared_ptr<prefs::Preferences> preferences);

  const std::shared_ptr<prefs::Preferences> preferences_;
};

}  // namespace ek
