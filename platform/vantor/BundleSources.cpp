#include "platform/vantor/BundleSources.h"

#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <ctime>
#include <string_view>
#include <vector>

#include "platform/cbor/Cbor.h"
#include "platform/value/Value.h"

namespace ek::vantor {
namespace {

using Look = BundleSources::Look;

// Stats name, relative to directory when that is a descriptor. Absent only when the system
// says so: EACCES or EIO prove nothing about the file.
Look look(int directory, const char* name, FileStamp& stamp) {
  struct stat st {};
  if (::fstatat(directory, name, &st, 0) == 0) {
    stamp = FileStamp::of(st);
    return Look::Present;
  }
  return errno == ENOENT || errno == ENOTDIR ? Look::Absent : Look::Unknown;
}

bool settled(const FileStamp& stamp, int64_t seconds) {
  struct timespec now {};
  ::clock_gettime(CLOCK_REALTIME, &now);
  int64_t latest = std::max<int64_t>(stamp.modified.tv_sec, stamp.changed.tv_sec);
  return now.tv_sec - latest >= seconds;
}

uint64_t number(const Value& value) {
  const uint64_t* n = value.unsignedNumber();
  return n ? *n : UINT64_MAX;
}

// [path, shared] for an absent file; [path, shared, device, inode, size, mtime s, mtime ns,
// ctime s, ctime ns] for a present one.
Value encodeSource(const std::string& path, bool shared, const std::optional<FileStamp>& stamp) {
  Array entry{Value(path), Value(shared)};
  if (stamp) {
    for (uint64_t field :
         {static_cast<uint64_t>(stamp->device), static_cast<uint64_t>(stamp->inode),
          static_cast<uint64_t>(stamp->size), static_cast<uint64_t>(stamp->modified.tv_sec),
          static_cast<uint64_t>(stamp->modified.tv_nsec),
          static_cast<uint64_t>(stamp->changed.tv_sec),
          static_cast<uint64_t>(stamp->changed.tv_nsec)}) {
      entry.emplace_back(field);
    }
  }
  return Value(std::move(entry));
}

FileStamp decodeStamp(const Array& entry) {
  auto field = [&](size_t i) { return number(entry[i]); };
  FileStamp stamp;
  stamp.device = static_cast<dev_t>(field(2));
  stamp.inode = static_cast<ino_t>(field(3));
  stamp.size = static_cast<off_t>(field(4));
  stamp.modified = {static_cast<time_t>(field(5)), static_cast<long>(field(6))};
  stamp.changed = {static_cast<time_t>(field(7)), static_cast<long>(field(8))};
  return stamp;
}

}  // namespace

BundleSources::BundleSources(std::string context, int64_t settleSeconds)
    : context_(std::move(context)), settleSeconds_(settleSeconds) {}

void BundleSources::note(const std::string& path) {
  add(path, false);
}

void BundleSources::noteShared(const std::string& path) {
  add(path, true);
}

void BundleSources::add(const std::string& path, bool shared) {
  if (!checkable_) return;
  if (sources_.size() == kMaxSources) {
    checkable_ = false;
    return;
  }
  FileStamp stamp;
  switch (look(AT_FDCWD, path.c_str(), stamp)) {
    case Look::Present:
      if (!settled(stamp, settleSeconds_)) {
        checkable_ = false;
        return;
      }
      sources_.push_back({path, stamp, shared});
      return;
    case Look::Absent:
      sources_.push_back({path, std::nullopt, shared});
      return;
    case Look::Unknown:
      checkable_ = false;
      return;
  }
}

std::optional<std::vector<uint8_t>> BundleSources::record() const {
  if (!checkable_) return std::nullopt;
  Array entries;
  entries.reserve(sources_.size());
  for (const Source& source : sources_) {
    entries.push_back(encodeSource(source.path, source.shared, source.stamp));
  }
  std::vector<uint8_t> bytes =
      cbor::encode(Value(Array{Value(context_), Value(std::move(entries))}));
  if (bytes.size() > kMaxRecordBytes) return std::nullopt;
  return bytes;
}

BundleSources::Look BundleSources::Checker::look(std::string_view path, FileStamp& stamp) {
  if (directoryFd_.valid() && path.size() > directory_.size() && path.starts_with(directory_)) {
    return vantor::look(directoryFd_.get(), std::string(path.substr(directory_.size())).c_str(),
                        stamp);
  }
  const std::string whole(path);
  const Look seen = vantor::look(AT_FDCWD, whole.c_str(), stamp);
  // The next paths likely lie below this one's directory (a bundle's files below the bundle's
  // parent directory). A directory that cannot be opened is simply not kept.
  const size_t slash = path.rfind('/');
  if (slash != std::string_view::npos && slash > 0) {
    std::string directory(path.substr(0, slash + 1));
    directoryFd_.reset(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    directory_ = directoryFd_.valid() ? std::move(directory) : std::string();
  }
  return seen;
}

bool BundleSources::Checker::unchanged(std::span<const uint8_t> record) {
  if (record.empty() || record.size() > kMaxRecordBytes) return false;
  auto decoded = cbor::decode(record);
  if (!decoded.ok()) return false;
  const Array* top = decoded->array();
  if (top == nullptr || top->size() != 2) return false;
  const std::string* context = (*top)[0].string();
  const Array* entries = (*top)[1].array();
  if (context == nullptr || *context != context_ || entries == nullptr ||
      entries->size() > kMaxSources) {
    return false;
  }
  // A file recorded absent needs no look of its own when its directory was recorded present
  // before it: creating the file since would have changed the directory's stamp, and the
  // record holds only when the directory's entry does too. A bundle records a handful of
  // files; past kMaxSearched, files are looked at rather than searched for.
  static constexpr size_t kMaxSearched = 64;
  std::vector<std::string_view> present;
  auto directoryRecordedPresent = [&](std::string_view path) {
    const size_t slash = path.rfind('/');
    if (slash == std::string_view::npos || slash == 0 || present.size() > kMaxSearched) {
      return false;
    }
    return std::find(present.begin(), present.end(), path.substr(0, slash)) != present.end();
  };
  for (const Value& value : *entries) {
    const Array* entry = value.array();
    if (entry == nullptr || (entry->size() != 2 && entry->size() != 9)) return false;
    const std::string* path = (*entry)[0].string();
    const bool* shared = (*entry)[1].boolean();
    if (path == nullptr || shared == nullptr) return false;
    std::optional<FileStamp> recorded;
    if (entry->size() == 9) {
      recorded = decodeStamp(*entry);
      present.push_back(*path);
    } else if (directoryRecordedPresent(*path)) {
      continue;
    }

    std::optional<FileStamp> now;
    auto cached = *shared ? shared_.find(*path) : shared_.end();
    if (cached != shared_.end()) {
      now = cached->second;
    } else {
      FileStamp stamp;
      Look seen = look(*path, stamp);
      if (seen == Look::Unknown) return false;
      if (seen == Look::Present) now = stamp;
      if (*shared) shared_.emplace(*path, now);
    }
    if (now != recorded) return false;
  }
  return true;
}

}  // namespace ek::vantor
