#pragma once

#include <sys/types.h>

#include <string>
#include <string_view>
#include <vector>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

// dmap: the structured-dictionary file format. A UTF-8 XML document whose root element
// <dmap version="1.0"> holds exactly one value:
//
//   <dict>      <key>text</key> followed by one value, repeated; keys unique
//   <array>     values
//   <string>    text (only the predefined entities and numeric character references)
//   <integer>   decimal; signed 64-bit, or unsigned 64-bit above the signed range
//   <real>      decimal floating point, read as a double
//   <true/> <false/>
//   <date>      YYYY-MM-DDTHH:MM:SSZ (UTC), read as seconds since 1970
//   <data>      base64, whitespace allowed anywhere inside
//
// The reader never fetches anything from outside the document: a DOCTYPE is accepted only in
// its bare form (<!DOCTYPE dmap>, no external identifier, no internal subset) and any entity
// declaration is refused.
namespace ek::dmap {

// Dictionaries and arrays nest at most this deep (the root container is level 1).
inline constexpr size_t kMaxDepth = 512;
// Files larger than this are refused before they are read; parse() and write() hold
// documents to the same bound, so everything written can be read back.
inline constexpr size_t kMaxFileSize = 64 * 1024 * 1024;

// Parses a dmap document. Errors are Format errors whose message names the line
// ("line 12: duplicate key \"x\"").
Result<Value> parse(std::string_view bytes);

// Reads and parses a file. A missing file is the POSIX error ENOENT; other system failures
// carry their errno. A file that is not a regular file is a Format error, a file larger than
// kMaxFileSize the POSIX error EFBIG; neither is read. Content errors are Format errors naming
// the file and line ("<path>: line 12: ...").
Result<Value> readFile(const std::string& path);

// Whether write() can carry value placed depth containers below the document's root (the root
// value is at depth 0; an entry of writeEntry at level L is at depth L): success, or the Format
// error write() would refuse it with. Strings or keys that are not valid UTF-8 or hold
// characters XML 1.0 forbids (C0 controls other than tab, line feed and carriage return;
// U+FFFE, U+FFFF), non-finite doubles or dates, dates outside the years 0001-9999 and nesting
// deeper than kMaxDepth are refused. Sizes are not checked. The writer makes this same check of
// every value it writes, so what this accepts is written.
Result<void> checkWritable(const Value& value, size_t depth = 0);

// Bundles come from anyone who can write a directory: a dmap file read from one (its info
// dictionary, a strings table, an extension point's dictionary) is held to this size.
inline constexpr size_t kMaxBundleFileSize = 1024 * 1024;

// Reads and parses the file at relative beneath the directory open as directoryFd, without
// following a symbolic link, a "/" or ".." out of that directory, nor a /proc magic link.
// Errors name the file as directoryPath/relative and what is wrong with it: EXDEV for a path
// that leads out of the directory, a Format error for a file that is not a regular file,
// EFBIG for one larger than maxSize (none of these is read), ENOENT for a missing one, a
// Format error naming the line for bad content.
Result<Value> readFileBeneath(int directoryFd, const std::string& directoryPath,
                              std::string_view relative, size_t maxSize = kMaxBundleFileSize);
// The same, opening directory first (links in the directory's own path are followed: the
// caller named it).
Result<Value> readFileBeneath(const std::string& directory, std::string_view relative,
                              size_t maxSize = kMaxBundleFileSize);

// Writes the value as a dmap document, indented with tabs. Values the format cannot carry are
// refused with a Format error (see checkWritable), and so are documents larger than
// kMaxFileSize.
// Lossy on purpose: a UUID is written as its canonical string (and reads back as a string);
// a date is written to the whole second, rounded down.
Result<std::string> write(const Value& value);

// For a document whose root dictionary holds one large dictionary that changes an entry at a
// time: each entry is written once and kept, and the document is assembled from the kept
// texts, byte for byte what write() gives for the whole value, without writing them again.
//
// The text write() gives one dictionary entry (its key and value) at an indentation level
// (the root dictionary's entries are at level 1, those of a dictionary inside it at level 2).
Result<std::string> writeEntry(std::string_view key, const Value& value, size_t level);
// The document of root with root[key] a dictionary whose entries are entries, in key order,
// each from writeEntry at level 2. root's own value under key is not read.
Result<std::string> writeAssembled(const Dictionary& root, std::string_view key,
                                   const std::vector<const std::string*>& entries);

// Replaces path atomically and durably: a temporary file in the same directory, fchmod to
// mode (exactly, the umask does not apply), fsync, rename, fsync of the directory. On failure
// the temporary file is removed, the target is left as it was and the POSIX error returned
// (only a failure to sync the directory comes after the rename: the new file is then in
// place). A symbolic link at path is replaced, not followed. A value write() refuses is its
// Format error, and nothing is touched.
//
// Files of the runtime directory do not outlive a reboot (it is a tmpfs in production): they
// need the atomic replacement, which readers rely on, but not the two fsyncs, which are most of
// the cost on a disk. Durability::RuntimeOnly skips them.
enum class Durability { Durable, RuntimeOnly };
Result<void> writeFileAtomically(const std::string& path, const Value& value, mode_t mode = 0644,
                                 Durability durability = Durability::Durable);
// The same for raw bytes.
Result<void> writeBytesAtomically(const std::string& path, std::string_view bytes,
                                  mode_t mode = 0644, Durability durability = Durability::Durable);

// Removes what writeBytesAtomically leaves of path when the process dies between creating its
// temporary file and renaming it: the regular files named as its temporaries for path, in
// path's directory only. Answers how many went.
Result<size_t> removeStaleTemporaries(const std::string& path);

}  // namespace ek::dmap
