// SHA256_Init and its kin are deprecated in favour of the EVP interface; see KeyedSha256.
#define OPENSSL_SUPPRESS_DEPRECATED

#include "Ekora/EkSandbox.h"

#include <fmt/format.h>
#include <limits.h>
#include <openssl/crypto.h>
#include <openssl/rand.h>
#include <openssl/sha.h>
#include <pthread.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <charconv>

namespace ek {

namespace {

constexpr char kSeparator = ';';
constexpr size_t kMaxFlagsDigits = 10;

// Handles are unique across every sandbox of the process.
std::atomic<int64_t> nextHandle{1};

// A "match" issues a token per plug-in it answers, and a RAND_bytes call costs about 3 µs here
// whatever its size: each thread draws its nonces from a block fetched at once. A forked child
// drops the block it inherited, so no nonce is ever handed out twice.
std::atomic<uint64_t> forkGeneration{0};

bool randomNonce(std::array<uint8_t, sandbox::kNonceSize>& nonce) {
  static constexpr size_t kBlock = 256 * sandbox::kNonceSize;
  static const bool registered = [] {
    pthread_atfork(nullptr, nullptr,
                   [] { forkGeneration.fetch_add(1, std::memory_order_relaxed); });
    return true;
  }();
  (void)registered;
  struct Pool {
    std::array<uint8_t, kBlock> bytes;
    size_t used = kBlock;
    uint64_t generation = 0;
  };
  thread_local Pool pool;
  const uint64_t generation = forkGeneration.load(std::memory_order_relaxed);
  if (pool.generation != generation) {
    pool.used = kBlock;
    pool.generation = generation;
  }
  if (pool.used == kBlock) {
    if (RAND_bytes(pool.bytes.data(), static_cast<int>(kBlock)) != 1) return false;
    pool.used = 0;
  }
  std::copy_n(pool.bytes.begin() + static_cast<std::ptrdiff_t>(pool.used), nonce.size(),
              nonce.begin());
  pool.used += nonce.size();
  return true;
}

void appendHex(std::string& out, std::string_view bytes) {
  static constexpr char kDigits[] = "0123456789abcdef";
  const size_t start = out.size();
  out.resize(start + bytes.size() * 2);
  char* hex = out.data() + start;
  for (unsigned char byte : bytes) {
    *hex++ = kDigits[byte >> 4];
    *hex++ = kDigits[byte & 0xf];
  }
}

std::string_view asText(const uint8_t* bytes, size_t size) {
  return std::string_view(reinterpret_cast<const char*>(bytes), size);
}

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return -1;  // upper case is refused too: a token has exactly one spelling
}

std::optional<std::string> fromHex(std::string_view hex) {
  if (hex.size() % 2 != 0) return std::nullopt;
  std::string bytes;
  bytes.reserve(hex.size() / 2);
  for (size_t i = 0; i < hex.size(); i += 2) {
    const int high = hexDigit(hex[i]);
    const int low = hexDigit(hex[i + 1]);
    if (high < 0 || low < 0) return std::nullopt;
    bytes.push_back(static_cast<char>((high << 4) | low));
  }
  return bytes;
}

bool isValidClass(std::string_view extensionClass) {
  if (extensionClass.empty() || extensionClass.size() > sandbox::kMaxClassLength) return false;
  for (char c : extensionClass) {
    if (c <= ' ' || c > '~' || c == kSeparator) return false;
  }
  return true;
}

bool isValidSubject(std::string_view subject) {
  return !subject.empty() && subject.size() <= sandbox::kMaxSubjectLength &&
         subject.find('\0') == std::string_view::npos;
}

// Decimal without leading zeros, so that one flags value has one spelling.
std::optional<uint32_t> parseFlags(std::string_view text) {
  if (text.empty() || text.size() > kMaxFlagsDigits || (text.size() > 1 && text[0] == '0')) {
    return std::nullopt;
  }
  uint32_t value = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return value;
}

// HMAC-SHA256 with the key's two padded states prepared once per thread and key. OpenSSL's
// digest and MAC contexts allocate a fresh algorithm context for every copy of a prepared
// state, two per tag: for the hundreds of tokens of one match reply those allocations cost
// more than the hashing. The plain SHA-256 state is a value that copies without allocating,
// which is why this one translation unit uses OpenSSL's low-level digest interface.
class KeyedSha256 {
 public:
  static_assert(kSandboxKeySize <= SHA256_CBLOCK, "a longer key would be hashed first");

  ~KeyedSha256() { OPENSSL_cleanse(this, sizeof(*this)); }

  std::array<uint8_t, sandbox::kTagSize> tag(const EkSandboxKey& key, std::string_view message) {
    if (!prepared_ || key_ != key) prepare(key);
    static_assert(sandbox::kTagSize == SHA256_DIGEST_LENGTH);
    std::array<uint8_t, SHA256_DIGEST_LENGTH> inner;
    std::array<uint8_t, sandbox::kTagSize> tag;
    SHA256_CTX context = inner_;
    SHA256_Update(&context, message.data(), message.size());
    SHA256_Final(inner.data(), &context);
    context = outer_;
    SHA256_Update(&context, inner.data(), inner.size());
    SHA256_Final(tag.data(), &context);
    OPENSSL_cleanse(&context, sizeof(context));
    return tag;
  }

 private:
  void prepare(const EkSandboxKey& key) {
    std::array<uint8_t, SHA256_CBLOCK> pad{};
    std::copy(key.begin(), key.end(), pad.begin());
    for (uint8_t& byte : pad) byte ^= 0x36;
    SHA256_Init(&inner_);
    SHA256_Update(&inner_, pad.data(), pad.size());
    for (uint8_t& byte : pad) byte ^= 0x36 ^ 0x5c;
    SHA256_Init(&outer_);
    SHA256_Update(&outer_, pad.data(), pad.size());
    OPENSSL_cleanse(pad.data(), pad.size());
    key_ = key;
    prepared_ = true;
  }

  SHA256_CTX inner_;
  SHA256_CTX outer_;
  EkSandboxKey key_{};
  bool prepared_ = false;
};

std::array<uint8_t, sandbox::kTagSize> computeTag(const EkSandboxKey& key,
                                                  std::string_view message) {
  thread_local KeyedSha256 keyed;
  return keyed.tag(key, message);
}

// The grant a token carries when its form is right and its tag verifies.
std::optional<EkSandboxGrant> verify(std::string_view token, const EkSandboxKey& key) {
  if (token.size() > sandbox::kMaxTokenLength) return std::nullopt;
  std::array<std::string_view, 5> fields;
  size_t start = 0;
  for (size_t index = 0; index < fields.size(); ++index) {
    const size_t end = token.find(kSeparator, start);
    const bool last = index + 1 == fields.size();
    if (last != (end == std::string_view::npos)) return std::nullopt;
    fields[index] = token.substr(start, last ? std::string_view::npos : end - start);
    start = end + 1;
  }
  const auto& [extensionClass, flagsText, subjectHex, nonceHex, tagHex] = fields;
  if (!isValidClass(extensionClass)) return std::nullopt;
  const std::optional<uint32_t> flags = parseFlags(flagsText);
  if (!flags) return std::nullopt;
  if (subjectHex.size() > 2 * sandbox::kMaxSubjectLength) return std::nullopt;
  std::optional<std::string> subject = fromHex(subjectHex);
  if (!subject || !isValidSubject(*subject)) return std::nullopt;
  if (nonceHex.size() != 2 * sandbox::kNonceSize || !fromHex(nonceHex)) return std::nullopt;
  if (tagHex.size() != 2 * sandbox::kTagSize) return std::nullopt;
  const std::optional<std::string> tag = fromHex(tagHex);
  if (!tag) return std::nullopt;

  const std::string_view message = token.substr(0, token.size() - tagHex.size() - 1);
  const auto expected = computeTag(key, message);
  if (CRYPTO_memcmp(expected.data(), tag->data(), expected.size()) != 0) {
    return std::nullopt;
  }
  return EkSandboxGrant{std::string(extensionClass), *flags, std::move(*subject)};
}

}  // namespace

EkSandbox::EkSandbox(std::shared_ptr<EkSandboxKeySource> keys) : keys_(std::move(keys)) {}

std::shared_ptr<EkSandbox> EkSandbox::system() {
  static const std::shared_ptr<EkSandbox> sandbox =
      std::make_shared<EkSandbox>(std::make_shared<EkSandboxFileKeySource>());
  return sandbox;
}

Result<std::string> EkSandbox::issueFileExtension(std::string_view path, uint32_t flags) {
  const std::string requested(path);
  if (requested.empty() || requested.front() != '/' || requested.find('\0') != std::string::npos ||
      requested.size() >= PATH_MAX) {
    return EkError::posix(EINVAL, fmt::format("cannot issue an extension for \"{}\"", requested));
  }
  std::string subject;
  if ((flags & sandbox::kCanonicalizeFlag) != 0) {
    char* resolved = ::realpath(requested.c_str(), nullptr);
    if (resolved == nullptr) return EkError::fromErrno(errno, requested);
    subject = resolved;
    ::free(resolved);
  } else {
    struct stat status;
    if (::stat(requested.c_str(), &status) != 0) return EkError::fromErrno(errno, requested);
    subject = requested;
  }
  return issue(sandbox::kReadOnlyFileClass, flags, subject);
}

Result<std::string> EkSandbox::issueCanonicalFileExtension(std::string_view canonicalPath) {
  if (canonicalPath.empty() || canonicalPath.front() != '/' ||
      canonicalPath.find('\0') != std::string_view::npos || canonicalPath.size() >= PATH_MAX) {
    return EkError::posix(EINVAL,
                          fmt::format("cannot issue an extension for \"{}\"", canonicalPath));
  }
  return issue(sandbox::kReadOnlyFileClass, sandbox::kCanonicalizeFlag, canonicalPath);
}

Result<std::string> EkSandbox::issueServiceExtension(std::string_view extensionClass,
                                                     std::string_view serviceName, uint32_t flags) {
  if (!isValidClass(extensionClass) || !isValidSubject(serviceName)) {
    return EkError::posix(EINVAL, "cannot issue a service extension for that class and name");
  }
  return issue(extensionClass, flags, serviceName);
}

Result<std::string> EkSandbox::issue(std::string_view extensionClass, uint32_t flags,
                                     std::string_view subject) {
  if (!isValidSubject(subject)) {
    return EkError::posix(ENAMETOOLONG, "the extension's subject is too long");
  }
  Result<EkSandboxKey> key = keys_->key();
  if (!key) return std::move(key).error();
  std::array<uint8_t, sandbox::kNonceSize> nonce;
  if (!randomNonce(nonce)) {
    return EkError::posix(EIO, "no random bytes for an extension nonce");
  }
  std::string token;
  token.reserve(extensionClass.size() + 16 +
                2 * (subject.size() + nonce.size() + sandbox::kTagSize));
  token.append(extensionClass);
  token.push_back(kSeparator);
  std::array<char, kMaxFlagsDigits> digits;
  token.append(digits.data(),
               std::to_chars(digits.data(), digits.data() + digits.size(), flags).ptr);
  token.push_back(kSeparator);
  appendHex(token, subject);
  token.push_back(kSeparator);
  appendHex(token, asText(nonce.data(), nonce.size()));
  const auto tag = computeTag(*key, token);
  token.push_back(kSeparator);
  appendHex(token, asText(tag.data(), tag.size()));
  return token;
}

int64_t EkSandbox::consume(std::string_view token) {
  std::optional<EkSandboxGrant> granted;
  if (token.size() <= sandbox::kMaxTokenLength) {
    if (Result<EkSandboxKey> key = keys_->key(); key.ok()) granted = verify(token, *key);
  }
  if (!granted) {
    errno = EINVAL;
    return -1;
  }
  const int64_t handle = nextHandle.fetch_add(1, std::memory_order_relaxed);
  std::lock_guard lock(mutex_);
  grants_.emplace(handle, std::move(*granted));
  return handle;
}

int EkSandbox::release(int64_t handle) {
  size_t erased = 0;
  {
    std::lock_guard lock(mutex_);
    erased = grants_.erase(handle);
  }
  if (erased == 0) {
    errno = EBADF;
    return -1;
  }
  return 0;
}

std::optional<EkSandboxGrant> EkSandbox::grant(int64_t handle) const {
  std::lock_guard lock(mutex_);
  auto found = grants_.find(handle);
  if (found == grants_.end()) return std::nullopt;
  return found->second;
}

size_t EkSandbox::heldCount() const {
  std::lock_guard lock(mutex_);
  return grants_.size();
}

}  // namespace ek
