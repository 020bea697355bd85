#include "ekd/EkDUserPrefs.h"

namespace ek {

EkDUserPrefs::EkDUserPrefs(std::shared_ptr<prefs::Preferences> preferences)
    : preferences_(std::move(preferences)) {}

std::shared_ptr<EkDUserPrefs> EkDUserPrefs::init(std::shared_ptr<prefs::Preferences> preferences) {
  if (!preferences) preferences = std::make_shared<prefs::FilePreferences>();
  return std::shared_ptr<EkDUserPrefs>(new EkDUserPrefs(std::move(preferences)));
}

std::optional<Value> EkDUserPrefs::exclusions() {
  return preferences_->value(kDomain, kExclusionsKey);
}

}  // namespace ek
