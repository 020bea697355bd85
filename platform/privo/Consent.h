#pragma once

#include <sys/types.h>

#include <cstddef>
#include <ctime>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/io/FileStamp.h"
#include "platform/value/Value.h"

// Privo, privacy consent: which consent services the user granted to each application.
namespace ek::privo {

// Network access for a keyboard that asks for open access.
inline constexpr std::string_view kKeyboardNetworkService = "com.corvane.privo.keyboard-network";
// The consent file's name inside the state directory.
inline constexpr std::string_view kConsentFileName = "consent.dmap";
// Larger consent files are refused unread.
inline constexpr size_t kMaxConsentFileSize = 4 * 1024 * 1024;

class Consent {
 public:
  virtual ~Consent() = default;
  // The services granted to the application, sorted and without duplicates; empty when the
  // application is unknown or nothing is granted. Thread-safe.
  virtual std::vector<std::string> grantedServices(
      std::string_view applicationBundleIdentifier) = 0;
  // grantedServices, or nothing when the consent information cannot be had at all (the
  // consent file is unusable): the caller then says so rather than taking it as a refusal.
  virtual std::optional<std::vector<std::string>> informationForApplication(
      std::string_view applicationBundleIdentifier) {
    return grantedServices(applicationBundleIdentifier);
  }
};

// $EKORA_STATE_DIR/consent.dmap: application bundle identifier -> dictionary of service
// identifier -> boolean granted. Only an entry that is boolean true grants; entries of other
// kinds grant nothing. The file is read again whenever its device, inode, size or modification
// time changed. A missing file grants nothing; an unusable one (unreadable, too large, not
// dmap, not a dictionary) grants nothing and is logged once per version of the file.
class FileConsent final : public Consent {
 public:
  // stateDirectory empty: paths::stateDir(), looked up on each read so the variable may be
  // set after construction.
  explicit FileConsent(std::string stateDirectory = {});

  std::vector<std::string> grantedServices(std::string_view applicationBundleIdentifier) override;
  // Nothing while the file is unusable; a missing file answers an empty list.
  std::optional<std::vector<std::string>> informationForApplication(
      std::string_view applicationBundleIdentifier) override;

  std::string path() const;

 private:
  // REQUIRES: mutex_ held.
  void synchronize();

  const std::string stateDirectory_;
  std::mutex mutex_;
  // Guarded by mutex_: the granted services per application as of the file read last.
  std::map<std::string, std::vector<std::string>, std::less<>> granted_;
  // Of the file read last; nothing when it was missing or never looked at.
  std::optional<FileStamp> stamp_;
  bool read_ = false;
  // Whether the file read last was unusable (so nothing is known of any application).
  bool unusable_ = false;
  // The version of the file whose failure was logged last, so each is logged once.
  std::optional<std::pair<std::optional<FileStamp>, std::string>> logged_;
};

// In memory, set by tests.
class FakeConsent final : public Consent {
 public:
  std::vector<std::string> grantedServices(std::string_view applicationBundleIdentifier) override;

  std::optional<std::vector<std::string>> informationForApplication(
      std::string_view applicationBundleIdentifier) override;

  void grant(std::string applicationBundleIdentifier, std::string service);
  // While unavailable, informationForApplication answers nothing.
  void setUnavailable(bool unavailable);
  void revokeAll(std::string_view applicationBundleIdentifier);
  // Every application asked about, in order.
  std::vector<std::string> queries() const;

 private:
  mutable std::mutex mutex_;
  std::map<std::string, std::vector<std::string>, std::less<>> granted_;
  std::vector<std::string> queries_;
  bool unavailable_ = false;
};

}  // namespace ek::privo
