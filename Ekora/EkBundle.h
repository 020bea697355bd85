#pragma once

#include <cstddef>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "Ekora/EkFileURL.h"
#include "platform/dmap/Dmap.h"
#include "platform/value/EkError.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace ek {

// Names and limits of the bundle layout on disk.
namespace bundle {
inline constexpr std::string_view kInfoFileName = "Info.dmap";
inline constexpr std::string_view kIdentifierKey = "QvBundleIdentifier";
inline constexpr std::string_view kExecutableKey = "QvBundleExecutable";
inline constexpr std::string_view kPlugInsDirectory = "PlugIns";
inline constexpr std::string_view kApplicationSuffix = ".app";
inline constexpr std::string_view kLocalizationSuffix = ".lproj";
inline constexpr std::string_view kStringsSuffix = ".strings";
// Localizes the values of the info dictionary.
inline constexpr std::string_view kInfoStringsTable = "InfoDmap";
// The table used when a caller names none.
inline constexpr std::string_view kDefaultStringsTable = "Localizable";

// Bundles come from anyone who can write a directory: everything read from one is bounded,
// its dmap files (info dictionary, strings tables) alike.
inline constexpr size_t kMaxInfoFileSize = dmap::kMaxBundleFileSize;
// How many ancestors of an executable are searched for the bundle that declares it.
inline constexpr size_t kMaxExecutableSearchDepth = 16;
// Longest QvBundleExecutable honoured, and longest language or table name.
inline constexpr size_t kMaxExecutableNameLength = 1024;
inline constexpr size_t kMaxComponentLength = 255;
// How many localizations localizations() lists at most.
inline constexpr size_t kMaxLocalizations = 256;
}  // namespace bundle

// How a path is resolved to a bundle.
enum class EkBundleMode {
  Bundle = 1,      // the path is the bundle directory
  Executable = 2,  // the path is an executable; its bundle is the nearest ancestor declaring it
};

// The numbered properties a bundle object answers.
enum class EkBundleProperty {
  BundlePath = 2,
  ExecutablePath = 3,
  SupportPath = 9,
};

// A path resolved to a bundle: the bundle facility of the platform, realised on the directory
// layout. Immutable once made, so it can be shared between threads. An object that did not
// resolve answers nothing.
class EkBundleObject {
 public:
  // Never null. A path that is not absolute, or that does not resolve in the given mode, gives
  // an object that answers nothing. Reads the info dictionary once.
  static std::shared_ptr<const EkBundleObject> create(std::string_view path, EkBundleMode mode);

  std::optional<std::string> stringProperty(EkBundleProperty property) const;
  // The parsed Info.dmap; nullptr when the bundle did not resolve or has no usable one.
  const Dictionary* infoDictionary() const { return info_ ? &*info_ : nullptr; }
  // Why infoDictionary() is absent for a resolved bundle (ENOENT, a format error, a size or
  // file-type refusal); nullptr when it is present or the bundle did not resolve.
  const EkError* infoDictionaryError() const { return infoError_ ? &*infoError_ : nullptr; }

 private:
  EkBundleObject() = default;

  std::optional<std::string> bundlePath_;
  std::optional<std::string> executablePath_;
  std::optional<Dictionary> info_;
  std::optional<EkError> infoError_;
};

// A light reader of a bundle directory: its path, its executable, its support and plug-ins
// directories, its info dictionary and strings tables. Thread-safe.
class EkBundle {
 public:
  // nullptr for URL text that is not a file URL.
  static std::shared_ptr<EkBundle> initWithURL(const EkFileURL& url);
  static std::shared_ptr<EkBundle> initWithURL(std::string_view urlText);
  // The reader of the bundle directory at path. nullptr only for a path that is empty,
  // relative or holds a NUL byte; a path that is no bundle gives a reader answering nothing.
  static std::shared_ptr<EkBundle> initWithPath(std::string_view path);
  static std::shared_ptr<EkBundle> initWithExecutableURL(const EkFileURL& url);
  static std::shared_ptr<EkBundle> initWithExecutableURL(std::string_view urlText);
  // The reader of the bundle that contains the executable: the nearest ancestor (at most
  // kMaxExecutableSearchDepth levels up) whose Info.dmap names this file as its
  // QvBundleExecutable. When there is none, the path is read as a bundle directory itself.
  static std::shared_ptr<EkBundle> initWithExecutablePath(std::string_view path);
  // nullptr when bundle is null. All other factories end here.
  static std::shared_ptr<EkBundle> initWithWyreBundle(std::shared_ptr<const EkBundleObject> bundle);

  std::optional<std::string> stringProperty(EkBundleProperty property) const;
  std::optional<std::string> path() const;
  std::optional<EkFileURL> url() const;
  // The declared executable, or the bundle path when the bundle declares none.
  std::optional<std::string> executablePath() const;
  // Computed once, then cached.
  std::optional<std::string> supportPath() const;
  std::optional<std::string> bundleDirectory(std::string_view name) const;
  std::optional<std::string> plugInsPath() const;
  std::optional<std::string> bundleIdentifier() const;

  // Valid as long as the reader lives.
  const Dictionary* infoDictionary() const { return bundle_->infoDictionary(); }
  const EkError* infoDictionaryError() const { return bundle_->infoDictionaryError(); }
  const std::shared_ptr<const EkBundleObject>& wyreBundle() const { return bundle_; }

  // The application two levels up when this bundle sits directly in an .app's PlugIns.
  std::optional<std::string> containingApplicationPath() const;
  // Whether the bundle lies on the system volume ($EKORA_SYSTEM_ROOT).
  bool isOnSystemVolume() const;

  // The strings table <bundle>/<language>.lproj/<table>.strings, read beneath the bundle
  // (dmap::readFileBeneath). Errors: ENOENT when the bundle did not resolve or the file is
  // missing, EINVAL for a table or language that is not a plain file name, EXDEV for a link
  // out of the bundle, EFBIG over kMaxInfoFileSize, a Format error for a file that is not a
  // regular file holding a dmap dictionary.
  Result<Dictionary> stringsTable(std::string_view table, std::string_view language) const;
  // The first string under key in table for languages, tried in order.
  std::optional<std::string> localizedString(std::string_view key, std::string_view table,
                                             std::span<const std::string> languages) const;
  // An info value localized through the InfoDmap table, else the info dictionary's own string.
  std::optional<std::string> localizedInfoString(std::string_view key,
                                                 std::span<const std::string> languages) const;
  // The languages with a <language>.lproj directory, sorted.
  std::vector<std::string> localizations() const;

 private:
  explicit EkBundle(std::shared_ptr<const EkBundleObject> bundle) : bundle_(std::move(bundle)) {}

  const std::shared_ptr<const EkBundleObject> bundle_;
  mutable std::mutex supportPathMutex_;
  mutable std::optional<std::string> supportPath_;  // guarded by supportPathMutex_
};

// The containing application of a plug-in at plugInPath: the directory two levels up when the
// plug-in sits directly in the PlugIns directory of an .app bundle. Purely lexical.
std::optional<std::string> containingApplicationPath(std::string_view plugInPath);

// Whether path lies under the system volume ($EKORA_SYSTEM_ROOT). Purely lexical.
bool isOnSystemVolume(std::string_view path);

// Where system plug-ins live: $EKORA_SYSTEM_ROOT/Library/PlugIns.
std::string systemPlugInsPath();

}  // namespace ek
