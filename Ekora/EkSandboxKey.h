#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/value/Result.h"

namespace ek {

inline constexpr size_t kSandboxKeySize = 32;
using EkSandboxKey = std::array<uint8_t, kSandboxKeySize>;

// Where the secret that authenticates sandbox extension tokens comes from.
class EkSandboxKeySource {
 public:
  virtual ~EkSandboxKeySource() = default;
  // Once a source has answered a key it answers the same key for the rest of its life.
  virtual Result<EkSandboxKey> key() = 0;
};

// The key kept in a file, by default $EKORA_STATE_DIR/sandbox.key, made on first use.
//
// The file is honoured only when it is a regular file (not a symbolic link) of exactly
// kSandboxKeySize bytes, owned by the effective user, with no permission bits for group or
// others. Anything else is refused and never repaired or replaced: EINVAL for a file of the
// wrong type or size, EPERM for the wrong owner or mode, ELOOP for a link. A missing file is
// created: the key is written to a temporary file made with O_EXCL and mode 0600, synced, then
// hard-linked into place, so two processes racing to create it agree on one key and nobody
// ever reads a partly written one. Failures are not cached; the next call tries again.
class EkSandboxFileKeySource : public EkSandboxKeySource {
 public:
  explicit EkSandboxFileKeySource(std::string path = defaultPath());

  static std::string defaultPath();

  Result<EkSandboxKey> key() override;
  const std::string& path() const { return path_; }

 private:
  Result<EkSandboxKey> load();
  Result<EkSandboxKey> create();

  const std::string path_;
  std::mutex mutex_;
  std::optional<EkSandboxKey> key_;  // guarded by mutex_
};

// A key held in memory: for tests, fuzzing and processes that never share tokens.
class EkSandboxMemoryKeySource : public EkSandboxKeySource {
 public:
  explicit EkSandboxMemoryKeySource(const EkSandboxKey& key) : key_(key) {}
  // A source with a fresh random key.
  static std::shared_ptr<EkSandboxMemoryKeySource> random();

  Result<EkSandboxKey> key() override { return key_; }

 private:
  const EkSandboxKey key_;
};

}  // namespace ek
