// Consumes arbitrary text as a sandbox extension token under a fixed key: nothing may crash,
// a refusal is always EINVAL, and what is granted is a handle that releases exactly once.
// The same text used as a service name must issue a token that consumes to exactly that name.
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "Ekora/EkSandbox.h"

namespace {

ek::EkSandbox& fuzzSandbox() {
  static ek::EkSandbox sandbox(std::make_shared<ek::EkSandboxMemoryKeySource>([] {
    ek::EkSandboxKey key;
    for (size_t i = 0; i < key.size(); ++i) key[i] = static_cast<uint8_t>(i * 7 + 1);
    return key;
  }()));
  return sandbox;
}

void releaseOnce(ek::EkSandbox& sandbox, int64_t handle) {
  if (sandbox.release(handle) != 0) abort();
  errno = 0;
  if (sandbox.release(handle) != -1 || errno != EBADF) abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  ek::EkSandbox& sandbox = fuzzSandbox();
  const std::string_view text(reinterpret_cast<const char*>(data), size);

  errno = 0;
  const int64_t handle = sandbox.consume(text);
  if (handle == -1) {
    if (errno != EINVAL) abort();
  } else {
    std::optional<ek::EkSandboxGrant> grant = sandbox.grant(handle);
    if (handle <= 0 || !grant || grant->subject.empty() ||
        grant->subject.size() > ek::sandbox::kMaxSubjectLength ||
        grant->subject.find('\0') != std::string::npos) {
      abort();
    }
    releaseOnce(sandbox, handle);
  }

  ek::Result<std::string> token =
      sandbox.issueServiceExtension(ek::sandbox::kPlugInServiceClass, text, 0);
  if (!token.ok()) return 0;
  if (token->size() > ek::sandbox::kMaxTokenLength) abort();
  const int64_t issued = sandbox.consume(*token);
  if (issued <= 0) abort();
  std::optional<ek::EkSandboxGrant> grant = sandbox.grant(issued);
  if (!grant || grant->subject != text ||
      grant->extensionClass != ek::sandbox::kPlugInServiceClass) {
    abort();
  }
  releaseOnce(sandbox, issued);
  return 0;
}
