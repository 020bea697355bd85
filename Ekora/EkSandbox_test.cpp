#include "Ekora/EkSandbox.h"

#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "Ekora/EkSandboxKey.h"
#include "platform/testing/Files.h"

namespace ek {
namespace {

namespace fs = std::filesystem;
using testing::writeFile;

EkSandboxKey keyOf(uint8_t fill) {
  EkSandboxKey key;
  key.fill(fill);
  return key;
}

std::string hexOf(std::string_view text) {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string hex;
  for (unsigned char c : text) hex += {kDigits[c >> 4], kDigits[c & 0xf]};
  return hex;
}

std::string joined(const std::vector<std::string>& fields) {
  std::string text;
  for (const std::string& field : fields) text += (text.empty() ? "" : ";") + field;
  return text;
}

// The token as the holder of the key makes it: the fields, then the HMAC-SHA256 of them.
std::string signedToken(std::vector<std::string> fields, uint8_t keyFill = 0x5a) {
  const std::string message = joined(fields);
  const EkSandboxKey key = keyOf(keyFill);
  unsigned char tag[EVP_MAX_MD_SIZE];
  size_t length = 0;
  EVP_Q_mac(nullptr, "HMAC", nullptr, "SHA256", nullptr, key.data(), key.size(),
            reinterpret_cast<const unsigned char*>(message.data()), message.size(), tag,
            sizeof(tag), &length);
  return message + ";" + hexOf(std::string_view(reinterpret_cast<const char*>(tag), length));
}

std::vector<std::string> fieldsOf(const std::string& token) {
  std::vector<std::string> fields;
  for (size_t start = 0, end = 0; end != std::string::npos; start = end + 1) {
    end = token.find(';', start);
    fields.push_back(token.substr(start, end == std::string::npos ? end : end - start));
  }
  return fields;
}

class EkSandboxTest : public ::testing::Test {
 protected:
  EkSandbox sandbox_{std::make_shared<EkSandboxMemoryKeySource>(keyOf(0x5a))};
  testing::TempDir temp_;
  const std::string dir_ = fs::canonical(temp_.path()).string();

  std::string issued() { return sandbox_.issueFileExtension(dir_, 1).value(); }
};

// Each token is the standard HMAC of its fields (outside tools verify it so) and grants what
// it names: the canonical path only when asked to canonicalize.
TEST_F(EkSandboxTest, TokensAreSignedFieldsGrantingWhatTheyName) {
  fs::create_directories(dir_ + "/real");
  fs::create_directory_symlink(dir_ + "/real", dir_ + "/link");
  const std::string longest(sandbox::kMaxSubjectLength, 's');  // both at their bounds
  const struct {
    Result<std::string> token;
    std::string extensionClass, subject;
    uint32_t flags;
  } rows[] = {
      {sandbox_.issueFileExtension(dir_ + "/link/.", 1), std::string(sandbox::kReadOnlyFileClass),
       dir_ + "/real", 1},
      {sandbox_.issueServiceExtension(std::string(sandbox::kMaxClassLength, 'c'), longest,
                                      UINT32_MAX),
       std::string(sandbox::kMaxClassLength, 'c'), longest, UINT32_MAX},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.subject.substr(0, 40));
    ASSERT_TRUE(row.token.ok());
    EXPECT_LE(row.token->size(), sandbox::kMaxTokenLength);
    std::vector<std::string> fields = fieldsOf(*row.token);
    ASSERT_EQ(fields.size(), 5u);
    fields.pop_back();
    EXPECT_EQ(*row.token, signedToken(fields));
    const int64_t handle = sandbox_.consume(*row.token);
    ASSERT_GT(handle, 0);
    EXPECT_EQ(sandbox_.grant(handle)->extensionClass, row.extensionClass);
    EXPECT_EQ(sandbox_.grant(handle)->subject, row.subject);
    EXPECT_EQ(sandbox_.grant(handle)->flags, row.flags);
  }
}

// Every token below is refused with EINVAL; those made with the key are refused for what they
// say, not for their tag.
TEST_F(EkSandboxTest, ForgedMalformedAndForeignTokensAreRefused) {
  const std::string token = issued();
  const std::vector<std::string> fields = fieldsOf(token);
  auto with = [&](size_t field, std::string value) {
    std::vector<std::string> changed = fields;
    changed[field] = std::move(value);
    return joined(changed);
  };
  auto signedWith = [&](size_t field, std::string value) {
    std::vector<std::string> changed = fieldsOf(with(field, std::move(value)));
    changed.pop_back();
    return signedToken(changed);
  };
  std::vector<std::pair<std::string, std::string>> rows{
      {"flags with a leading zero", signedWith(1, "01")},
      {"subject holding a NUL byte", signedWith(2, hexOf(std::string("a\0b", 3)))},
      {"another key", signedToken({fields[0], fields[1], fields[2], fields[3]}, 0xa5)},
      {"class", with(0, std::string(sandbox::kPlugInServiceClass))},
      {"flags", with(1, "0")},
      {"the root", with(2, hexOf("/"))},
      {"nonce", with(3, std::string(fields[3].size(), 'a'))},
      {"trailing separator", token + ";"},
      {"leading field", ";" + token},
      {"separators only", std::string(1024 * 1024, ';')},
  };
  for (size_t offset = token.size() - 64; offset < token.size(); offset += 7) {
    std::string flipped = token;
    flipped[offset] = flipped[offset] == '0' ? '1' : '0';
    rows.push_back({"tag digit " + std::to_string(offset), flipped});
  }
  for (size_t length = 0; length < token.size(); length += 5) {
    rows.push_back({"prefix of " + std::to_string(length), token.substr(0, length)});
  }
  for (size_t field = 2; field < 5; ++field) {
    std::string upper = fields[field];
    for (char& c : upper) c = static_cast<char>(toupper(static_cast<unsigned char>(c)));
    rows.push_back({"upper case in field " + std::to_string(field), with(field, upper)});
    rows.push_back(
        {"odd length in field " + std::to_string(field), with(field, fields[field].substr(1))});
  }
  ASSERT_GT(sandbox_.consume(signedWith(1, "1")), 0) << "a token signed here is valid";
  for (const auto& [why, forged] : rows) {
    errno = 0;
    EXPECT_EQ(sandbox_.consume(forged), -1) << why;
    EXPECT_EQ(errno, EINVAL) << why;
  }
}

// ---- the key file ----

TEST(EkSandboxKeyFile, RacingCreatorsAgreeOnOneOwnerOnlyKey) {
  testing::TempDir temp;
  const std::string path = temp.file("state/sandbox.key");
  std::vector<Result<EkSandboxKey>> keys(8, EkError{"", 0, ""});
  std::vector<std::thread> threads;
  for (auto& key : keys) threads.emplace_back([&] { key = EkSandboxFileKeySource(path).key(); });
  for (auto& thread : threads) thread.join();
  for (const auto& key : keys) EXPECT_EQ(key.value(), keys[0].value());
  struct stat status;
  ASSERT_EQ(lstat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600u);
  EXPECT_EQ(status.st_size, static_cast<off_t>(kSandboxKeySize));
}

// A key file anyone else could read or change, or of the wrong kind, is refused and kept; a
// sandbox without its key neither issues nor consumes.
TEST(EkSandboxKeyFile, UnsafeKeyIsRefusedAndKept) {
  const std::string key(kSandboxKeySize, 'k');
  const struct {
    std::string name, bytes;
    mode_t mode;
    int error;
  } rows[] = {
      {"mode 0644", key, 0644, EPERM},        {"mode 0602", key, 0602, EPERM},
      {"short", key.substr(1), 0600, EINVAL}, {"long", key + "k", 0600, EINVAL},
      {"directory", "", 0700, EINVAL},        {"link", key, 0600, ELOOP},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    testing::TempDir temp;
    const std::string path = temp.file("sandbox.key");
    const std::string target = row.name == "link" ? path + ".real" : path;
    if (row.name == "directory") {
      fs::create_directories(target);
    } else {
      writeFile(target, row.bytes);
    }
    chmod(target.c_str(), row.mode);
    if (target != path) fs::create_symlink(target, path);
    const auto before = fs::symlink_status(path).type();
    auto source = std::make_shared<EkSandboxFileKeySource>(path);
    Result<EkSandboxKey> loaded = source->key();
    ASSERT_FALSE(loaded.ok());
    EXPECT_TRUE(loaded.error().isPosix(row.error)) << loaded.error().message;
    EXPECT_EQ(fs::symlink_status(path).type(), before);
    EkSandbox sandbox(source);
    EXPECT_FALSE(sandbox.issueServiceExtension("c", "svc", 0).ok());
  }
}

}  // namespace
}  // namespace ek
