#include "Ekora/EkSandboxExtension.h"

#include <fmt/format.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>

#include "platform/log/Log.h"

namespace ek {

Result<std::string> issueFileExtension(const EkFileURL& url) {
  return issueFileExtension(url, *EkSandbox::system());
}

Result<std::string> issueFileExtension(const EkFileURL& url, EkSandbox& sandbox) {
  Result<std::string> token = sandbox.issueFileExtension(url.path(), sandbox::kCanonicalizeFlag);
  if (token) log::sandbox().debug("issued file extension for %s -> %s", url.path(), *token);
  return token;
}

Result<void> checkRegisteredBundle(std::string_view bundlePath,
                                   const std::optional<EkBundleIdentity>& identity) {
  const std::string bundle(bundlePath);
  if (!identity) {
    return EkError::posix(ESTALE,
                          fmt::format("{}: the bundle's directory was not recorded", bundle));
  }
  // The path as named and the canonical path the token will name, which must still be the
  // directory itself rather than a link: a link there could be turned elsewhere once the
  // token is out.
  auto registered = [&](const struct stat& status) {
    return S_ISDIR(status.st_mode) && static_cast<uint64_t>(status.st_dev) == identity->device &&
           static_cast<uint64_t>(status.st_ino) == identity->inode;
  };
  // Named by its canonical path, the directory that lstat finds is the one stat would: one
  // call then answers for both.
  bool same = true;
  if (bundle != identity->canonicalPath) {
    struct stat named {};
    if (::stat(bundle.c_str(), &named) != 0) return EkError::fromErrno(errno, bundle);
    same = registered(named);
  }
  struct stat canonical {};
  if (::lstat(identity->canonicalPath.c_str(), &canonical) != 0) {
    return EkError::fromErrno(errno, identity->canonicalPath);
  }
  same = same && registered(canonical);
  if (!same) {
    return EkError::posix(ESTALE, fmt::format("{}: not the directory that was registered", bundle));
  }
  return {};
}

Result<std::string> issueBundleExtension(std::string_view bundlePath,
                                         const std::optional<EkBundleIdentity>& identity,
                                         std::string_view relative, EkSandbox& sandbox) {
  if (Result<void> checked = checkRegisteredBundle(bundlePath, identity); !checked) {
    return std::move(checked).error();
  }
  const std::string& root = identity->canonicalPath;
  std::string subject = root;
  if (!relative.empty() && relative != ".") {
    // An absolute entry names what it names, and is then refused unless that lies inside.
    const std::string target = relative.front() == '/' ? std::string(relative)
                               : root == "/"           ? fmt::format("/{}", relative)
                                                       : fmt::format("{}/{}", root, relative);
    char* resolved = ::realpath(target.c_str(), nullptr);
    if (resolved == nullptr) return EkError::fromErrno(errno, target);
    subject = resolved;
    ::free(resolved);
    const bool inside =
        subject == root || root == "/" ||
        (subject.size() > root.size() && subject.starts_with(root) && subject[root.size()] == '/');
    if (!inside) {
      return EkError::posix(EPERM, fmt::format("{}: leads out of the bundle", target));
    }
  }
  Result<std::string> token = sandbox.issueCanonicalFileExtension(subject);
  if (token) log::sandbox().debug("issued file extension for %s -> %s", subject, *token);
  return token;
}

Result<std::string> issueServiceExtension(std::string_view serviceName) {
  return issueServiceExtension(serviceName, *EkSandbox::system());
}

Result<std::string> issueServiceExtension(std::string_view serviceName, EkSandbox& sandbox) {
  Result<std::string> token =
      sandbox.issueServiceExtension(sandbox::kPlugInServiceClass, serviceName, 0);
  if (token) log::sandbox().debug("issued service extension for %s -> %s", serviceName, *token);
  return token;
}

EkSandboxExtension::EkSandboxExtension(std::string token, std::shared_ptr<EkSandbox> sandbox)
    : token_(std::move(token)), sandbox_(sandbox ? std::move(sandbox) : EkSandbox::system()) {}

std::shared_ptr<EkSandboxExtension> EkSandboxExtension::initWithExtension(
    std::string token, std::shared_ptr<EkSandbox> sandbox) {
  return std::make_shared<EkSandboxExtension>(std::move(token), std::move(sandbox));
}

EkSandboxExtension::~EkSandboxExtension() {
  expel();
}

void EkSandboxExtension::consume() {
  if (handle_.load() != kNotConsumed) return;
  const int64_t handle = sandbox_->consume(token_);
  const int error = errno;
  handle_.store(handle);
  if (handle == kNotConsumed) {
    log::sandbox().defaultLevel("failed to consume extension %s - errno=%d", token_, error);
  } else {
    log::sandbox().debug("consuming extension %s -> %ld", token_, handle);
  }
}

void EkSandboxExtension::expel() {
  const int64_t handle = handle_.load();
  if (handle == kNotConsumed) return;
  if (sandbox_->release(handle) == 0) {
    log::sandbox().debug("releasing extension %ld", handle);
  } else {
    const int error = errno;
    log::sandbox().defaultLevel("failed to release extension %ld - errno=%d", handle, error);
  }
  handle_.store(kNotConsumed);
}

}  // namespace ek
