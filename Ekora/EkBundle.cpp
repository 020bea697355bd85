#include "Ekora/EkBundle.h"

#include <dirent.h>
#include <fmt/format.h>
#include <limits.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>

#include "platform/dmap/Dmap.h"
#include "platform/paths/Directories.h"

namespace ek {

namespace {

// An absolute path with repeated slashes, "." components and trailing slashes removed. ".."
// is kept: resolving it lexically could name a different directory than the file system does.
std::optional<std::string> normalizePath(std::string_view path) {
  if (path.empty() || path.front() != '/' || path.size() >= PATH_MAX ||
      path.find('\0') != std::string_view::npos) {
    return std::nullopt;
  }
  std::string result;
  result.reserve(path.size());
  size_t position = 0;
  while (position < path.size()) {
    size_t end = path.find('/', position);
    if (end == std::string_view::npos) end = path.size();
    const std::string_view component = path.substr(position, end - position);
    if (!component.empty() && component != ".") {
      result.push_back('/');
      result.append(component);
    }
    position = end + 1;
  }
  if (result.empty()) result.push_back('/');
  return result;
}

// The parent of a normalized path; absent for the root.
std::optional<std::string> parentPath(const std::string& path) {
  if (path == "/") return std::nullopt;
  const size_t slash = path.rfind('/');
  if (slash == 0) return std::string("/");
  return path.substr(0, slash);
}

std::string_view lastComponent(std::string_view path) {
  const size_t slash = path.rfind('/');
  return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

std::string appendComponent(const std::string& directory, std::string_view name) {
  if (directory == "/") return fmt::format("/{}", name);
  return fmt::format("{}/{}", directory, name);
}

// A single file name: nothing that could walk out of the directory it is looked up in.
bool isPlainComponent(std::string_view name) {
  return !name.empty() && name.size() <= bundle::kMaxComponentLength && name != "." &&
         name != ".." && name.find('/') == std::string_view::npos &&
         name.find('\0') == std::string_view::npos;
}

// QvBundleExecutable must name a file inside the bundle: a relative path of plain components.
bool isValidExecutableName(std::string_view name) {
  if (name.empty() || name.size() > bundle::kMaxExecutableNameLength) return false;
  size_t position = 0;
  while (position <= name.size()) {
    size_t end = name.find('/', position);
    if (end == std::string_view::npos) end = name.size();
    if (!isPlainComponent(name.substr(position, end - position))) return false;
    position = end + 1;
  }
  return true;
}

// The dmap file at relative beneath the bundle directory, whose root is a dictionary. Nothing
// a bundle holds may make the reader follow a link out of it or read a special file.
Result<Dictionary> readDictionaryFile(const std::string& directory, std::string_view relative) {
  Result<Value> value = dmap::readFileBeneath(directory, relative, bundle::kMaxInfoFileSize);
  if (!value) return std::move(value).error();
  Dictionary* dictionary = value->dictionary();
  if (dictionary == nullptr) {
    return EkError::format(fmt::format("{}: the root value is not a dictionary",
                                       appendComponent(directory, relative)));
  }
  return std::move(*dictionary);
}

}  // namespace

// ---- EkBundleObject ----

std::shared_ptr<const EkBundleObject> EkBundleObject::create(std::string_view path,
                                                             EkBundleMode mode) {
  std::shared_ptr<EkBundleObject> object(new EkBundleObject());
  const std::optional<std::string> normalized = normalizePath(path);
  if (!normalized) return object;

  struct stat status;
  if (::stat(normalized->c_str(), &status) != 0) return object;

  if (mode == EkBundleMode::Bundle) {
    if (!S_ISDIR(status.st_mode)) return object;
    object->bundlePath_ = *normalized;
    Result<Dictionary> info = readDictionaryFile(*normalized, bundle::kInfoFileName);
    if (!info) {
      object->infoError_ = std::move(info).error();
      return object;
    }
    const Value* executable = nullptr;
    if (auto found = info->find(bundle::kExecutableKey); found != info->end()) {
      executable = &found->second;
    }
    if (executable != nullptr && executable->string() != nullptr &&
        isValidExecutableName(*executable->string())) {
      object->executablePath_ = appendComponent(*normalized, *executable->string());
    }
    object->info_ = std::move(info).value();
    return object;
  }

  // Only an existing file can be an executable; anything else is left to the caller's fallback.
  if (!S_ISREG(status.st_mode)) return object;
  std::optional<std::string> ancestor = parentPath(*normalized);
  for (size_t depth = 0; ancestor && depth < bundle::kMaxExecutableSearchDepth; ++depth) {
    Result<Dictionary> info = readDictionaryFile(*ancestor, bundle::kInfoFileName);
    if (info) {
      auto found = info->find(bundle::kExecutableKey);
      const std::string* executable = found == info->end() ? nullptr : found->second.string();
      if (executable != nullptr && isValidExecutableName(*executable) &&
          appendComponent(*ancestor, *executable) == *normalized) {
        object->bundlePath_ = *ancestor;
        object->executablePath_ = *normalized;
        object->info_ = std::move(info).value();
        return object;
      }
    }
    ancestor = parentPath(*ancestor);
  }
  return object;
}

std::optional<std::string> EkBundleObject::stringProperty(EkBundleProperty property) const {
  switch (property) {
    case EkBundleProperty::BundlePath:
      return bundlePath_;
    case EkBundleProperty::ExecutablePath:
      return executablePath_;
    // The support directory of a bundle is the bundle directory itself.
    case EkBundleProperty::SupportPath:
      return bundlePath_;
  }
  return std::nullopt;
}

// ---- EkBundle ----

std::shared_ptr<EkBundle> EkBundle::initWithURL(const EkFileURL& url) {
  return initWithPath(url.path());
}

std::shared_ptr<EkBundle> EkBundle::initWithURL(std::string_view urlText) {
  Result<EkFileURL> url = EkFileURL::parse(urlText);
  if (!url) return nullptr;
  return initWithURL(*url);
}

std::shared_ptr<EkBundle> EkBundle::initWithPath(std::string_view path) {
  if (!normalizePath(path)) return nullptr;
  return initWithWyreBundle(EkBundleObject::create(path, EkBundleMode::Bundle));
}

std::shared_ptr<EkBundle> EkBundle::initWithExecutableURL(const EkFileURL& url) {
  return initWithExecutablePath(url.path());
}

std::shared_ptr<EkBundle> EkBundle::initWithExecutableURL(std::string_view urlText) {
  Result<EkFileURL> url = EkFileURL::parse(urlText);
  if (!url) return nullptr;
  return initWithExecutableURL(*url);
}

std::shared_ptr<EkBundle> EkBundle::initWithExecutablePath(std::string_view path) {
  if (!normalizePath(path)) return nullptr;
  std::shared_ptr<const EkBundleObject> object =
      EkBundleObject::create(path, EkBundleMode::Executable);
  if (!object->stringProperty(EkBundleProperty::BundlePath)) {
    object = EkBundleObject::create(path, EkBundleMode::Bundle);
  }
  return initWithWyreBundle(std::move(object));
}

std::shared_ptr<EkBundle> EkBundle::initWithWyreBundle(
    std::shared_ptr<const EkBundleObject> bundle) {
  if (!bundle) return nullptr;
  return std::shared_ptr<EkBundle>(new EkBundle(std::move(bundle)));
}

std::optional<std::string> EkBundle::stringProperty(EkBundleProperty property) const {
  return bundle_->stringProperty(property);
}

std::optional<std::string> EkBundle::path() const {
  return stringProperty(EkBundleProperty::BundlePath);
}

std::optional<EkFileURL> EkBundle::url() const {
  std::optional<std::string> bundlePath = path();
  if (!bundlePath) return std::nullopt;
  Result<EkFileURL> url = EkFileURL::fromPath(*bundlePath);
  if (!url) return std::nullopt;
  return std::move(url).value();
}

std::optional<std::string> EkBundle::executablePath() const {
  if (auto executable = stringProperty(EkBundleProperty::ExecutablePath)) return executable;
  return path();
}

std::optional<std::string> EkBundle::supportPath() const {
  {
    std::lock_guard lock(supportPathMutex_);
    if (supportPath_) return supportPath_;
  }
  std::optional<std::string> support = stringProperty(EkBundleProperty::SupportPath);
  if (!support) return std::nullopt;
  std::lock_guard lock(supportPathMutex_);
  supportPath_ = support;
  return support;
}

std::optional<std::string> EkBundle::bundleDirectory(std::string_view name) const {
  std::optional<std::string> support = supportPath();
  if (!support) return std::nullopt;
  return appendComponent(*support, name);
}

std::optional<std::string> EkBundle::plugInsPath() const {
  return bundleDirectory(bundle::kPlugInsDirectory);
}

std::optional<std::string> EkBundle::bundleIdentifier() const {
  const Dictionary* info = infoDictionary();
  if (info == nullptr) return std::nullopt;
  auto found = info->find(bundle::kIdentifierKey);
  if (found == info->end() || found->second.string() == nullptr) return std::nullopt;
  return *found->second.string();
}

std::optional<std::string> EkBundle::containingApplicationPath() const {
  std::optional<std::string> bundlePath = path();
  if (!bundlePath) return std::nullopt;
  return ek::containingApplicationPath(*bundlePath);
}

bool EkBundle::isOnSystemVolume() const {
  std::optional<std::string> bundlePath = path();
  return bundlePath && ek::isOnSystemVolume(*bundlePath);
}

Result<Dictionary> EkBundle::stringsTable(std::string_view table, std::string_view language) const {
  if (!isPlainComponent(table) || !isPlainComponent(language)) {
    return EkError::posix(EINVAL, "a strings table and its language must be plain file names");
  }
  std::optional<std::string> bundlePath = path();
  if (!bundlePath) return EkError::posix(ENOENT, "the bundle did not resolve");
  return readDictionaryFile(*bundlePath,
                            fmt::format("{}{}/{}{}", language, bundle::kLocalizationSuffix, table,
                                        bundle::kStringsSuffix));
}

std::optional<std::string> EkBundle::localizedString(std::string_view key, std::string_view table,
                                                     std::span<const std::string> languages) const {
  for (const std::string& language : languages) {
    Result<Dictionary> strings = stringsTable(table, language);
    if (!strings) continue;
    auto found = strings->find(key);
    if (found != strings->end() && found->second.string() != nullptr) {
      return *found->second.string();
    }
  }
  return std::nullopt;
}

std::optional<std::string> EkBundle::localizedInfoString(
    std::string_view key, std::span<const std::string> languages) const {
  if (auto localized = localizedString(key, bundle::kInfoStringsTable, languages)) {
    return localized;
  }
  const Dictionary* info = infoDictionary();
  if (info == nullptr) return std::nullopt;
  auto found = info->find(key);
  if (found == info->end() || found->second.string() == nullptr) return std::nullopt;
  return *found->second.string();
}

std::vector<std::string> EkBundle::localizations() const {
  std::vector<std::string> languages;
  std::optional<std::string> bundlePath = path();
  if (!bundlePath) return languages;
  DIR* directory = ::opendir(bundlePath->c_str());
  if (directory == nullptr) return languages;
  while (languages.size() < bundle::kMaxLocalizations) {
    const dirent* entry = ::readdir(directory);
    if (entry == nullptr) break;
    const std::string_view name(entry->d_name);
    if (name.size() <= bundle::kLocalizationSuffix.size() ||
        !name.ends_with(bundle::kLocalizationSuffix)) {
      continue;
    }
    struct stat status;
    if (::fstatat(::dirfd(directory), entry->d_name, &status, 0) != 0 || !S_ISDIR(status.st_mode)) {
      continue;
    }
    languages.emplace_back(name.substr(0, name.size() - bundle::kLocalizationSuffix.size()));
  }
  ::closedir(directory);
  std::sort(languages.begin(), languages.end());
  return languages;
}

// ---- free functions ----

std::optional<std::string> containingApplicationPath(std::string_view plugInPath) {
  const std::optional<std::string> normalized = normalizePath(plugInPath);
  if (!normalized) return std::nullopt;
  const std::optional<std::string> plugIns = parentPath(*normalized);
  if (!plugIns || lastComponent(*plugIns) != bundle::kPlugInsDirectory) return std::nullopt;
  std::optional<std::string> application = parentPath(*plugIns);
  if (!application) return std::nullopt;
  const std::string_view name = lastComponent(*application);
  if (name.size() <= bundle::kApplicationSuffix.size() ||
      !name.ends_with(bundle::kApplicationSuffix)) {
    return std::nullopt;
  }
  return application;
}

bool isOnSystemVolume(std::string_view path) {
  const std::optional<std::string> root = normalizePath(paths::systemRoot());
  const std::optional<std::string> normalized = normalizePath(path);
  if (!root || !normalized) return false;
  if (*root == "/") return *normalized != "/";
  return normalized->size() > root->size() + 1 && normalized->starts_with(*root) &&
         (*normalized)[root->size()] == '/';
}

std::string systemPlugInsPath() {
  return paths::join(paths::systemRoot(), "Library/PlugIns");
}

}  // namespace ek
