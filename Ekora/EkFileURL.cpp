#include "Ekora/EkFileURL.h"

#include <fmt/format.h>

#include <optional>

namespace ek {

namespace {

bool isAlpha(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
}
bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

// Characters a path segment may carry unescaped (RFC 3986 pchar), plus the separator.
bool isPathCharacter(char c) {
  if (isAlpha(c) || isDigit(c)) return true;
  switch (c) {
    case '-':
    case '.':
    case '_':
    case '~':  // unreserved
    case '!':
    case '$':
    case '&':
    case '\'':
    case '(':
    case ')':  // sub-delims
    case '*':
    case '+':
    case ',':
    case ';':
    case '=':
    case ':':
    case '@':
    case '/':
      return true;
    default:
      return false;
  }
}

std::optional<int> hexValue(char c) {
  if (isDigit(c)) return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return std::nullopt;
}

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) return false;
  for (size_t i = 0; i < a.size(); ++i) {
    char x = a[i];
    char y = b[i];
    if (x >= 'A' && x <= 'Z') x = static_cast<char>(x - 'A' + 'a');
    if (y >= 'A' && y <= 'Z') y = static_cast<char>(y - 'A' + 'a');
    if (x != y) return false;
  }
  return true;
}

std::string withoutTrailingSlashes(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  return std::string(path);
}

}  // namespace

Result<EkFileURL> EkFileURL::fromPath(std::string_view path) {
  if (path.empty()) return EkError::format("file URL: empty path");
  if (path.find('\0') != std::string_view::npos) {
    return EkError::format("file URL: path holds a NUL byte");
  }
  if (path.front() != '/') {
    return EkError::format(fmt::format("file URL: path is not absolute: {}", path));
  }
  return EkFileURL(withoutTrailingSlashes(path));
}

Result<EkFileURL> EkFileURL::parse(std::string_view text) {
  size_t colon = text.find(':');
  if (colon == std::string_view::npos || !equalsIgnoringCase(text.substr(0, colon), "file")) {
    return EkError::format("file URL: not a file URL");
  }
  std::string_view rest = text.substr(colon + 1);
  if (rest.starts_with("//")) {
    rest.remove_prefix(2);
    size_t slash = rest.find('/');
    std::string_view host = rest.substr(0, slash);
    if (!host.empty() && !equalsIgnoringCase(host, "localhost")) {
      return EkError::format("file URL: names another host");
    }
    if (slash == std::string_view::npos) return EkError::format("file URL: no path");
    rest.remove_prefix(slash);
  }
  if (rest.empty() || rest.front() != '/') {
    return EkError::format("file URL: path is not absolute");
  }
  if (rest.find_first_of("?#") != std::string_view::npos) {
    return EkError::format("file URL: query or fragment");
  }
  std::string path;
  path.reserve(rest.size());
  for (size_t i = 0; i < rest.size(); ++i) {
    char c = rest[i];
    if (c != '%') {
      if (c == '\0') return EkError::format("file URL: NUL byte");
      path.push_back(c);
      continue;
    }
    if (i + 2 >= rest.size()) return EkError::format("file URL: truncated percent escape");
    std::optional<int> high = hexValue(rest[i + 1]);
    std::optional<int> low = hexValue(rest[i + 2]);
    if (!high || !low) return EkError::format("file URL: malformed percent escape");
    int byte = *high * 16 + *low;
    if (byte == 0) return EkError::format("file URL: NUL byte");
    path.push_back(static_cast<char>(byte));
    i += 2;
  }
  return EkFileURL(withoutTrailingSlashes(path));
}

std::string EkFileURL::string() const {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out = "file://";
  out.reserve(out.size() + path_.size());
  for (char c : path_) {
    if (isPathCharacter(c)) {
      out.push_back(c);
    } else {
      auto byte = static_cast<unsigned char>(c);
      out.push_back('%');
      out.push_back(kHex[byte >> 4]);
      out.push_back(kHex[byte & 0xF]);
    }
  }
  return out;
}

Result<std::string> fileURLFromPath(std::string_view path) {
  Result<EkFileURL> url = EkFileURL::fromPath(path);
  if (!url) return std::move(url).error();
  return url->string();
}

Result<std::string> pathFromFileURL(std::string_view url) {
  Result<EkFileURL> parsed = EkFileURL::parse(url);
  if (!parsed) return std::move(parsed).error();
  return parsed->path();
}

}  // namespace ek
