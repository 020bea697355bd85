#include "platform/vantor/Registry.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "platform/io/UniqueFd.h"

namespace ek::vantor {
namespace {

constexpr size_t kMaxIdentifierBytes = 255;
// The locale file names a language; anything longer is not one.
constexpr size_t kMaxLocaleLine = 256;

bool startsWithOperator(std::string_view pattern) {
  if (pattern.empty()) return false;
  char c = pattern.front();
  return c == '?' || c == '<' || c == '>' || c == '=';
}

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

std::string normalisePath(std::string_view path) {
  std::string normal = std::filesystem::path(path).lexically_normal().string();
  while (normal.size() > 1 && normal.back() == '/') normal.pop_back();
  return normal;
}

}  // namespace

EkError makeError(ErrorCode code, std::string message) {
  return EkError{std::string(kErrorDomain), code, std::move(message)};
}

const Dictionary* PlugInProxy::extensionDictionary() const {
  auto it = info.find(kExtensionKey);
  return it == info.end() ? nullptr : it->second.dictionary();
}

std::vector<Uuid> Registry::queryUuids(const Dictionary& rules) {
  std::vector<Uuid> uuids;
  for (const PlugInProxyPtr& proxy : query(rules, nullptr)) uuids.push_back(proxy->uuid);
  return uuids;
}

size_t Registry::plugInCount() {
  return queryUuids({}).size();
}

bool Registry::applicationIsPlaceholder(std::string_view path) {
  ApplicationProxyPtr application = applicationByPath(path);
  return application && application->isPlaceholder;
}

std::string PlugInProxy::description() const {
  return fmt::format("<plug-in {} {} at {}>", identifier, uuid.string(), path);
}

Result<void> checkPlugInIdentifier(std::string_view identifier) {
  auto refuse = [&](std::string_view why) {
    return makeError(
        kInvalidIdentifier,
        fmt::format("plug-in identifier \"{}\" {}",
                    identifier.substr(0, std::min<size_t>(identifier.size(), 64)), why));
  };
  if (identifier.empty()) return makeError(kInvalidIdentifier, "plug-in identifier is empty");
  if (identifier == "." || identifier == "..") return refuse("is not a directory name");
  if (identifier.find('/') != std::string_view::npos) return refuse("contains \"/\"");
  if (identifier.find('\0') != std::string_view::npos) return refuse("contains a NUL byte");
  if (identifier.size() > kMaxIdentifierBytes) return refuse("is longer than 255 bytes");
  return {};
}

std::optional<std::vector<std::string>> indexedExtensionPoints(const Dictionary& rules) {
  auto it = rules.find(kExtensionPointKey);
  if (it == rules.end()) return std::nullopt;
  if (const std::string* text = it->second.string()) {
    if (startsWithOperator(*text)) return std::nullopt;
    return std::vector<std::string>{*text};
  }
  if (const Array* list = it->second.array()) {
    std::vector<std::string> points;
    for (const Value& element : *list) {
      const std::string* text = element.string();
      if (text == nullptr) continue;
      if (startsWithOperator(*text)) return std::nullopt;
      points.push_back(*text);
    }
    return points;
  }
  return std::nullopt;
}

std::vector<std::string> extensionPointIndexValues(const Dictionary& mergedInfo) {
  const Value* value = nullptr;
  auto extension = mergedInfo.find(kExtensionKey);
  if (extension != mergedInfo.end()) {
    if (const Value* attributes = extension->second.get(kExtensionAttributesKey)) {
      value = attributes->get(kExtensionPointKey);
    }
  }
  if (value == nullptr) {
    auto top = mergedInfo.find(kExtensionPointKey);
    if (top != mergedInfo.end()) value = &top->second;
  }
  std::vector<std::string> values;
  if (value == nullptr) return values;
  if (const std::string* text = value->string()) {
    values.push_back(*text);
  } else if (const Array* list = value->array()) {
    for (const Value& element : *list) {
      if (const std::string* text = element.string()) values.push_back(*text);
    }
  }
  return values;
}

std::string extensionPointIndexKey(std::string_view value) {
  std::string key;
  key.reserve(value.size());
  size_t i = 0;
  while (i < value.size()) {
    if (value[i] < '0' || value[i] > '9') {
      key.push_back(value[i++]);
      continue;
    }
    size_t end = i;
    while (end < value.size() && value[end] >= '0' && value[end] <= '9') ++end;
    size_t first = i;
    while (first + 1 < end && value[first] == '0') ++first;
    key.append(value.substr(first, end - first));
    i = end;
  }
  return key;
}

std::optional<BundleIdentity> bundleIdentityOf(int directoryFd, const std::string& path) {
  struct stat opened {};
  if (::fstat(directoryFd, &opened) != 0 || !S_ISDIR(opened.st_mode)) return std::nullopt;
  auto names = [&](const char* candidate) {
    struct stat named {};
    return ::stat(candidate, &named) == 0 && named.st_dev == opened.st_dev &&
           named.st_ino == opened.st_ino;
  };
  BundleIdentity identity{
      static_cast<uint64_t>(opened.st_dev), static_cast<uint64_t>(opened.st_ino), {}};
  // The kernel names the open directory in one call where realpath reads every component
  // (registering a large system volume did little else); path must still name it.
  char link[64];
  char target[PATH_MAX];
  std::snprintf(link, sizeof link, "/proc/self/fd/%d", directoryFd);
  ssize_t length = ::readlink(link, target, sizeof target);
  if (length > 0 && length < static_cast<ssize_t>(sizeof target) && target[0] == '/') {
    identity.canonicalPath.assign(target, static_cast<size_t>(length));
    if (!names(path.c_str())) return std::nullopt;
  } else {
    char* resolved = ::realpath(path.c_str(), nullptr);
    if (resolved == nullptr) return std::nullopt;
    identity.canonicalPath = resolved;
    ::free(resolved);
  }
  if (identity.canonicalPath != path && !names(identity.canonicalPath.c_str())) return std::nullopt;
  return identity;
}

std::optional<BundleIdentity> bundleIdentityOf(const std::string& path) {
  UniqueFd directory(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!directory.valid()) return std::nullopt;
  return bundleIdentityOf(directory.get(), path);
}

std::string fileUrlForPath(std::string_view path) {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string url = "file://";
  for (unsigned char c : path) {
    bool plain =
        (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
        std::string_view("-._~!$&'()*+,;=:@/").find(static_cast<char>(c)) != std::string_view::npos;
    if (plain) {
      url.push_back(static_cast<char>(c));
    } else {
      url.push_back('%');
      url.push_back(kHex[c >> 4]);
      url.push_back(kHex[c & 15]);
    }
  }
  return url;
}

std::optional<std::string> pathFromUrlOrPath(std::string_view text) {
  std::string path;
  if (!text.empty() && text.front() == '/') {
    path = std::string(text);
  } else {
    constexpr std::string_view kScheme = "file://";
    if (text.size() < kScheme.size()) return std::nullopt;
    for (size_t i = 0; i < kScheme.size(); ++i) {
      if (std::tolower(static_cast<unsigned char>(text[i])) != kScheme[i]) return std::nullopt;
    }
    std::string_view rest = text.substr(kScheme.size());
    size_t slash = rest.find('/');
    if (slash == std::string_view::npos) return std::nullopt;
    std::string_view host = rest.substr(0, slash);
    if (!host.empty() && host != "localhost") return std::nullopt;
    rest = rest.substr(slash);
    // Query and fragment are not part of the path.
    rest = rest.substr(0, rest.find_first_of("?#"));
    for (size_t i = 0; i < rest.size(); ++i) {
      if (rest[i] != '%') {
        path.push_back(rest[i]);
        continue;
      }
      if (i + 2 >= rest.size()) return std::nullopt;
      int high = hexValue(rest[i + 1]);
      int low = hexValue(rest[i + 2]);
      if (high < 0 || low < 0) return std::nullopt;
      path.push_back(static_cast<char>(high * 16 + low));
      i += 2;
    }
  }
  if (path.find('\0') != std::string::npos) return std::nullopt;
  return normalisePath(path);
}

std::vector<std::string> languageCandidates(std::string_view language) {
  std::string_view tag = language.substr(0, language.find_first_of(".@"));
  for (char c : tag) {
    bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
              c == '_' || c == '-';
    if (!ok) return {"en"};
  }
  if (tag.empty() || tag == "C" || tag == "POSIX") return {"en"};
  std::vector<std::string> candidates{std::string(tag)};
  size_t separator = tag.find_first_of("_-");
  if (separator != std::string_view::npos && separator > 0) {
    candidates.emplace_back(tag.substr(0, separator));
  }
  return candidates;
}

std::optional<std::string> readLocaleFile(const std::string& path) {
  std::ifstream file(path);
  if (!file) return std::nullopt;
  std::string line(kMaxLocaleLine, '\0');
  file.getline(line.data(), static_cast<std::streamsize>(line.size()));
  line.resize(
      std::min(line.size(), static_cast<size_t>(std::max<std::streamsize>(file.gcount(), 0))));
  while (!line.empty() && (line.back() == '\0' || line.back() == '\r' || line.back() == ' ' ||
                           line.back() == '\t')) {
    line.pop_back();
  }
  if (line.empty()) return std::nullopt;
  return line;
}

std::string environmentLanguage() {
  for (const char* name : {"EKORA_LOCALE", "LC_ALL", "LC_MESSAGES", "LANG"}) {
    const char* value = std::getenv(name);
    if (value != nullptr && *value != '\0') return value;
  }
  return "en";
}

std::string currentLanguage(const std::string& stateDir) {
  if (auto language = readLocaleFile(stateDir + "/locale")) return *language;
  return environmentLanguage();
}

}  // namespace ek::vantor
