#pragma once

#include <string>
#include <string_view>

#include "platform/value/Result.h"

namespace ek {

// A file URL: the location of a bundle on the local file system. It is only ever built from an
// absolute path or parsed from URL text, and it holds that path without trailing slashes, so
// "file:///a/B.appex/" and "file:///a/B.appex" name the same bundle and compare equal.
// Nothing here touches the file system.
class EkFileURL {
 public:
  // An absolute path, taken byte for byte (no "." or ".." processing). Refuses empty and
  // relative paths and paths holding a NUL byte, with a Format error.
  static Result<EkFileURL> fromPath(std::string_view path);

  // URL text "file://" [ "localhost" ] absolute-path, or the minimal "file:/path" form, with
  // the scheme in any case. The path is percent-decoded. Refuses other schemes, other hosts,
  // queries, fragments, malformed or NUL-producing percent escapes, with a Format error.
  static Result<EkFileURL> parse(std::string_view text);

  // The absolute path ("/" for the root).
  const std::string& path() const { return path_; }
  // The URL text: "file://" and the path, percent-encoded outside the characters a URL path
  // may carry as they are (RFC 3986 unreserved, sub-delimiters, ":", "@" and "/").
  std::string string() const;

  bool operator==(const EkFileURL&) const = default;

 private:
  explicit EkFileURL(std::string path) : path_(std::move(path)) {}

  std::string path_;
};

// The same operations as free functions over text.
Result<std::string> fileURLFromPath(std::string_view path);
Result<std::string> pathFromFileURL(std::string_view url);

}  // namespace ek
