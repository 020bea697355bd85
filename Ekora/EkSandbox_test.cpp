#include "Ekora/EkSandbox.h"

#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "Ekora/EkSandboxKey.h"

namespace ek {
namespace {

EkSandboxKey keyOf(uint8_t fill) {
  EkSandboxKey key;
  key.fill(fill);
  return key;
}

std::string hexOf(std::string_view text) {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string hex;
  for (unsigned char c : text) {
    hex.push_back(kDigits[c >> 4]);
    hex.push_back(kDigits[c & 0xf]);
  }
  return hex;
}

std::vector<std::string> fieldsOf(const std::string& token) {
  std::vector<std::string> fields;
  size_t start = 0;
  for (;;) {
    const size_t end = token.find(';', start);
    fields.push_back(token.substr(start, end == std::string::npos ? end : end - start));
    if (end == std::string::npos) return fields;
    start = end + 1;
  }
}

std::string joinFields(const std::vector<std::string>& fields) {
  std::string token;
  for (size_t i = 0; i < fields.size(); ++i) {
    if (i > 0) token.push_back(';');
    token += fields[i];
  }
  return token;
}

class TemporaryDirectory {
 public:
  TemporaryDirectory() {
    std::string pattern = "/tmp/eksandbox-XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) abort();
    char* real = realpath(pattern.c_str(), nullptr);
    path_ = real;
    free(real);
  }
  ~TemporaryDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  std::string at(const std::string& relative) const { return path_ + "/" + relative; }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

class EkSandboxTest : public ::testing::Test {
 protected:
  EkSandbox sandbox_{std::make_shared<EkSandboxMemoryKeySource>(keyOf(0x5a))};
  TemporaryDirectory directory_;

  std::string issueFor(const std::string& path) {
    Result<std::string> token = sandbox_.issueFileExtension(path, sandbox::kCanonicalizeFlag);
    EXPECT_TRUE(token.ok()) << (token.ok() ? "" : token.error().message);
    return token.ok() ? *token : std::string();
  }
  void expectRefused(const std::string& token, const std::string& why) {
    errno = 0;
    EXPECT_EQ(sandbox_.consume(token), -1) << why;
    EXPECT_EQ(errno, EINVAL) << why;
  }
};

TEST_F(EkSandboxTest, FileTokenRoundTripsToTheCanonicalPath) {
  std::filesystem::create_directories(directory_.at("real/Viewer.app"));
  std::filesystem::create_directory_symlink(directory_.at("real"), directory_.at("link"));
  const std::string token = issueFor(directory_.at("link/./Viewer.app"));
  const std::vector<std::string> fields = fieldsOf(token);
  ASSERT_EQ(fields.size(), 5u);
  EXPECT_EQ(fields[0], sandbox::kReadOnlyFileClass);
  EXPECT_EQ(fields[1], "1");
  EXPECT_EQ(fields[2], hexOf(directory_.at("real/Viewer.app")));

  const int64_t handle = sandbox_.consume(token);
  ASSERT_GT(handle, 0);
  std::optional<EkSandboxGrant> grant = sandbox_.grant(handle);
  ASSERT_TRUE(grant.has_value());
  EXPECT_EQ(grant->extensionClass, sandbox::kReadOnlyFileClass);
  EXPECT_EQ(grant->flags, sandbox::kCanonicalizeFlag);
  EXPECT_EQ(grant->subject, directory_.at("real/Viewer.app"));
}

TEST_F(EkSandboxTest, FileTokenWithoutCanonicalizingNamesThePathAsGiven) {
  std::filesystem::create_directories(directory_.at("real"));
  std::filesystem::create_directory_symlink(directory_.at("real"), directory_.at("link"));
  Result<std::string> token = sandbox_.issueFileExtension(directory_.at("link"), 0);
  ASSERT_TRUE(token.ok());
  EXPECT_EQ(fieldsOf(*token)[2], hexOf(directory_.at("link")));
}

TEST_F(EkSandboxTest, ServiceTokenRoundTrips) {
  Result<std::string> token =
      sandbox_.issueServiceExtension(sandbox::kPlugInServiceClass, "com.example.viewer.thumbs", 0);
  ASSERT_TRUE(token.ok());
  const int64_t handle = sandbox_.consume(*token);
  ASSERT_GT(handle, 0);
  EXPECT_EQ(sandbox_.grant(handle)->extensionClass, sandbox::kPlugInServiceClass);
  EXPECT_EQ(sandbox_.grant(handle)->subject, "com.example.viewer.thumbs");
  EXPECT_EQ(sandbox_.grant(handle)->flags, 0u);
}

// The tag is plain HMAC-SHA256 of everything before it, as outside tools verify it; tokens under
// two keys alternate so that each thread's prepared key state is set up again each time.
TEST_F(EkSandboxTest, TagIsTheStandardHmacOfTheRestUnderEachKey) {
  EkSandbox other{std::make_shared<EkSandboxMemoryKeySource>(keyOf(0xc3))};
  for (int round = 0; round < 3; ++round) {
    for (auto [sandbox, fill] : {std::pair{&sandbox_, 0x5a}, std::pair{&other, 0xc3}}) {
      // Subjects around the 64-byte block edges of the message.
      const std::string subject =
          "com.example." + std::string(static_cast<size_t>(round) * 23, 'x');
      Result<std::string> token =
          sandbox->issueServiceExtension(sandbox::kPlugInServiceClass, subject, 7);
      ASSERT_TRUE(token.ok());
      const size_t cut = token->rfind(';');
      const std::string message = token->substr(0, cut);
      const EkSandboxKey key = keyOf(static_cast<uint8_t>(fill));
      unsigned char expected[EVP_MAX_MD_SIZE];
      size_t length = 0;
      ASSERT_NE(EVP_Q_mac(nullptr, "HMAC", nullptr, "SHA256", nullptr, key.data(), key.size(),
                          reinterpret_cast<const unsigned char*>(message.data()), message.size(),
                          expected, sizeof(expected), &length),
                nullptr);
      EXPECT_EQ(token->substr(cut + 1),
                hexOf(std::string_view(reinterpret_cast<const char*>(expected), length)))
          << "round " << round << ", key " << fill;
      EXPECT_GT(sandbox->consume(*token), 0);
    }
  }
}

// Nonces come from blocks of random bytes drawn ahead: many issues span several blocks, and a
// forked child, which inherits the parent's block, must not hand out the parent's next nonces.
TEST_F(EkSandboxTest, IssuesOfOneSubjectNeverShareANonceAcrossBlocksOrAFork) {
  const std::string warmup = issueFor(directory_.path());
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    close(fds[0]);
    std::string nonces;
    for (int i = 0; i < 8; ++i) {
      Result<std::string> token = sandbox_.issueFileExtension(directory_.path(), 0);
      if (!token.ok()) _exit(1);
      nonces += fieldsOf(*token)[3] + "\n";
    }
    const bool written =
        write(fds[1], nonces.data(), nonces.size()) == static_cast<ssize_t>(nonces.size());
    _exit(written ? 0 : 1);
  }
  close(fds[1]);
  std::string fromChild;
  char buffer[512];
  for (ssize_t n; (n = read(fds[0], buffer, sizeof buffer)) > 0;) fromChild.append(buffer, n);
  close(fds[0]);
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);

  std::set<std::string> nonces{fieldsOf(warmup)[3]};
  size_t issued = 1;
  for (size_t start = 0, end; (end = fromChild.find('\n', start)) != std::string::npos;
       start = end + 1) {
    nonces.insert(fromChild.substr(start, end - start));
    ++issued;
  }
  EXPECT_EQ(issued, 9u);
  for (int i = 0; i < 1000; ++i) {
    const std::string token = issueFor(directory_.path());
    ASSERT_FALSE(token.empty());
    nonces.insert(fieldsOf(token)[3]);
    ++issued;
  }
  EXPECT_EQ(nonces.size(), issued);
}

TEST_F(EkSandboxTest, MissingPathCannotBeIssuedAndKeepsTheSystemError) {
  for (uint32_t flags : {sandbox::kCanonicalizeFlag, 0u}) {
    Result<std::string> token = sandbox_.issueFileExtension(directory_.at("missing"), flags);
    ASSERT_FALSE(token.ok());
    EXPECT_TRUE(token.error().isPosix(ENOENT)) << token.error().message;
  }
}

TEST_F(EkSandboxTest, RelativeOrEmptyPathCannotBeIssued) {
  for (const std::string& path :
       {std::string(""), std::string("relative/path"), std::string("/tmp/a\0b", 8)}) {
    Result<std::string> token = sandbox_.issueFileExtension(path, sandbox::kCanonicalizeFlag);
    ASSERT_FALSE(token.ok());
    EXPECT_TRUE(token.error().isPosix(EINVAL));
  }
}

TEST_F(EkSandboxTest, InvalidServiceClassOrNameCannotBeIssued) {
  EXPECT_FALSE(sandbox_.issueServiceExtension("", "svc", 0).ok());
  EXPECT_FALSE(sandbox_.issueServiceExtension("a;b", "svc", 0).ok());
  EXPECT_FALSE(sandbox_.issueServiceExtension("a b", "svc", 0).ok());
  EXPECT_FALSE(sandbox_.issueServiceExtension(sandbox::kPlugInServiceClass, "", 0).ok());
  EXPECT_FALSE(
      sandbox_.issueServiceExtension(sandbox::kPlugInServiceClass, std::string("a\0b", 3), 0).ok());
  EXPECT_FALSE(sandbox_
                   .issueServiceExtension(sandbox::kPlugInServiceClass,
                                          std::string(sandbox::kMaxSubjectLength + 1, 's'), 0)
                   .ok());
}

TEST_F(EkSandboxTest, LongestSubjectStillFitsTheTokenBound) {
  Result<std::string> token =
      sandbox_.issueServiceExtension(std::string(sandbox::kMaxClassLength, 'c'),
                                     std::string(sandbox::kMaxSubjectLength, 's'), UINT32_MAX);
  ASSERT_TRUE(token.ok());
  EXPECT_LE(token->size(), sandbox::kMaxTokenLength);
  EXPECT_GT(sandbox_.consume(*token), 0);
}

TEST_F(EkSandboxTest, FlippedTagByteIsRefused) {
  const std::string token = issueFor(directory_.path());
  for (size_t offset = token.size() - 64; offset < token.size(); offset += 7) {
    std::string forged = token;
    forged[offset] = forged[offset] == '0' ? '1' : '0';
    expectRefused(forged, "tag digit " + std::to_string(offset));
  }
}

TEST_F(EkSandboxTest, ChangedPathHexIsRefused) {
  std::filesystem::create_directories(directory_.at("a"));
  std::filesystem::create_directories(directory_.at("b"));
  std::vector<std::string> fields = fieldsOf(issueFor(directory_.at("a")));
  fields[2] = hexOf(directory_.at("b"));
  expectRefused(joinFields(fields), "path of another directory");
  fields[2] = hexOf("/");
  expectRefused(joinFields(fields), "the root");
}

TEST_F(EkSandboxTest, ChangedClassFlagsOrNonceIsRefused) {
  const std::vector<std::string> fields = fieldsOf(issueFor(directory_.path()));
  std::vector<std::string> forged = fields;
  forged[0] = sandbox::kPlugInServiceClass;
  expectRefused(joinFields(forged), "class");
  forged = fields;
  forged[1] = "0";
  expectRefused(joinFields(forged), "flags");
  forged = fields;
  forged[1] = "01";
  expectRefused(joinFields(forged), "flags with a leading zero");
  forged = fields;
  forged[3][0] = forged[3][0] == 'a' ? 'b' : 'a';
  expectRefused(joinFields(forged), "nonce");
}

TEST_F(EkSandboxTest, EveryTruncationIsRefused) {
  const std::string token = issueFor(directory_.path());
  for (size_t length = 0; length < token.size(); ++length) {
    expectRefused(token.substr(0, length), "prefix of " + std::to_string(length));
  }
}

TEST_F(EkSandboxTest, TokenFromAnotherKeyNeverValidates) {
  EkSandbox other(std::make_shared<EkSandboxMemoryKeySource>(keyOf(0xa5)));
  Result<std::string> token = other.issueFileExtension(directory_.path(), 1);
  ASSERT_TRUE(token.ok());
  EXPECT_GT(other.consume(*token), 0);
  expectRefused(*token, "another key");
}

TEST_F(EkSandboxTest, ExtraOrMissingFieldsAreRefused) {
  const std::string token = issueFor(directory_.path());
  expectRefused(token + ";", "trailing separator");
  expectRefused(token + ";00", "extra field");
  expectRefused(";" + token, "leading field");
  std::vector<std::string> fields = fieldsOf(token);
  fields.erase(fields.begin() + 3);
  expectRefused(joinFields(fields), "no nonce");
}

TEST_F(EkSandboxTest, NonHexOrUpperCaseHexIsRefused) {
  const std::vector<std::string> fields = fieldsOf(issueFor(directory_.path()));
  for (size_t field = 2; field < 5; ++field) {
    std::vector<std::string> forged = fields;
    forged[field][0] = 'g';
    expectRefused(joinFields(forged), "non-hex in field " + std::to_string(field));
    forged = fields;
    for (char& c : forged[field]) c = static_cast<char>(toupper(static_cast<unsigned char>(c)));
    if (forged[field] != fields[field]) {
      expectRefused(joinFields(forged), "upper case in field " + std::to_string(field));
    }
    forged = fields;
    forged[field].pop_back();
    expectRefused(joinFields(forged), "odd length in field " + std::to_string(field));
  }
}

TEST_F(EkSandboxTest, SubjectWithANulByteIsRefusedEvenWhenSigned) {
  // Only the key holder could make this token; it must still not name a truncated path.
  EkSandbox sandbox(std::make_shared<EkSandboxMemoryKeySource>(keyOf(0x5a)));
  Result<std::string> token = sandbox.issueServiceExtension("x", "ab", 0);
  ASSERT_TRUE(token.ok());
  std::vector<std::string> fields = fieldsOf(*token);
  fields[2] = hexOf(std::string("a\0b", 3));
  expectRefused(joinFields(fields), "NUL in subject");
}

TEST_F(EkSandboxTest, HugeTokenIsRefused) {
  const std::string token = issueFor(directory_.path());
  expectRefused(token + std::string(sandbox::kMaxTokenLength, '0'), "padded tag");
  expectRefused(std::string(sandbox::kMaxTokenLength + 1, 'a'), "long garbage");
  expectRefused(std::string(1024 * 1024, ';'), "separators only");
}

TEST_F(EkSandboxTest, EmptyAndGarbageTokensAreRefused) {
  for (const char* garbage : {"", ";", ";;;;", "a;0;;;", "hello", "a;0;61;00;00"}) {
    expectRefused(garbage, garbage);
  }
}

TEST_F(EkSandboxTest, HandlesArePositiveAndUniqueAcrossSandboxes) {
  EkSandbox other(std::make_shared<EkSandboxMemoryKeySource>(keyOf(0x5a)));
  const std::string token = issueFor(directory_.path());
  std::set<int64_t> handles;
  for (int i = 0; i < 50; ++i) {
    const int64_t mine = sandbox_.consume(token);
    const int64_t theirs = other.consume(token);
    ASSERT_GT(mine, 0);
    ASSERT_GT(theirs, 0);
    handles.insert(mine);
    handles.insert(theirs);
  }
  EXPECT_EQ(handles.size(), 100u);
  EXPECT_EQ(sandbox_.heldCount(), 50u);
}

TEST_F(EkSandboxTest, ConcurrentConsumesGiveDistinctHandles) {
  const std::string token = issueFor(directory_.path());
  std::vector<std::vector<int64_t>> perThread(4);
  std::vector<std::thread> threads;
  for (auto& handles : perThread) {
    threads.emplace_back([&] {
      for (int i = 0; i < 100; ++i) handles.push_back(sandbox_.consume(token));
    });
  }
  for (auto& thread : threads) thread.join();
  std::set<int64_t> all;
  for (const auto& handles : perThread) all.insert(handles.begin(), handles.end());
  EXPECT_EQ(all.size(), 400u);
  EXPECT_GT(*all.begin(), 0);
}

TEST_F(EkSandboxTest, ReleasingTwiceIsEBADF) {
  const int64_t handle = sandbox_.consume(issueFor(directory_.path()));
  ASSERT_GT(handle, 0);
  EXPECT_EQ(sandbox_.release(handle), 0);
  EXPECT_FALSE(sandbox_.grant(handle).has_value());
  errno = 0;
  EXPECT_EQ(sandbox_.release(handle), -1);
  EXPECT_EQ(errno, EBADF);
}

TEST_F(EkSandboxTest, ReleasingUnknownOrForeignHandlesIsEBADF) {
  EkSandbox other(std::make_shared<EkSandboxMemoryKeySource>(keyOf(0x5a)));
  const int64_t foreign = other.consume(issueFor(directory_.path()));
  ASSERT_GT(foreign, 0);
  for (int64_t handle : {int64_t{-1}, int64_t{0}, INT64_MAX, foreign}) {
    errno = 0;
    EXPECT_EQ(sandbox_.release(handle), -1) << handle;
    EXPECT_EQ(errno, EBADF) << handle;
  }
  EXPECT_EQ(other.release(foreign), 0);
}

// ---- the key file ----

class EkSandboxKeyFileTest : public ::testing::Test {
 protected:
  std::string keyPath() const { return directory_.at("state/sandbox.key"); }
  TemporaryDirectory directory_;
};

TEST_F(EkSandboxKeyFileTest, KeyIsCreatedOnFirstUseWithOwnerOnlyMode) {
  EkSandboxFileKeySource source(keyPath());
  Result<EkSandboxKey> key = source.key();
  ASSERT_TRUE(key.ok()) << key.error().message;
  struct stat status;
  ASSERT_EQ(lstat(keyPath().c_str(), &status), 0);
  EXPECT_TRUE(S_ISREG(status.st_mode));
  EXPECT_EQ(status.st_mode & 07777, 0600u);
  EXPECT_EQ(status.st_size, static_cast<off_t>(kSandboxKeySize));
  EXPECT_NE(*key, keyOf(0));
  // No temporary file is left behind.
  size_t entries = 0;
  for (const auto& entry : std::filesystem::directory_iterator(directory_.at("state"))) {
    (void)entry;
    ++entries;
  }
  EXPECT_EQ(entries, 1u);
}

TEST_F(EkSandboxKeyFileTest, TokensIssuedWithTheFileConsumeInAnotherReaderOfIt) {
  EkSandbox issuer(std::make_shared<EkSandboxFileKeySource>(keyPath()));
  EkSandbox consumer(std::make_shared<EkSandboxFileKeySource>(keyPath()));
  Result<std::string> token = issuer.issueServiceExtension("c", "svc", 0);
  ASSERT_TRUE(token.ok()) << token.error().message;
  EXPECT_GT(consumer.consume(*token), 0);
}

TEST_F(EkSandboxKeyFileTest, DefaultPathIsInTheStateDirectory) {
  setenv("EKORA_STATE_DIR", directory_.at("state").c_str(), 1);
  EXPECT_EQ(EkSandboxFileKeySource::defaultPath(), keyPath());
  unsetenv("EKORA_STATE_DIR");
}

TEST_F(EkSandboxKeyFileTest, RacingCreatorsAgreeOnOneKey) {
  std::vector<std::optional<EkSandboxKey>> keys(8);
  std::vector<std::thread> threads;
  for (auto& key : keys) {
    threads.emplace_back([&] {
      EkSandboxFileKeySource source(keyPath());
      Result<EkSandboxKey> loaded = source.key();
      if (loaded.ok()) key = *loaded;
    });
  }
  for (auto& thread : threads) thread.join();
  for (const auto& key : keys) {
    ASSERT_TRUE(key.has_value());
    EXPECT_EQ(*key, *keys[0]);
  }
}

TEST_F(EkSandboxKeyFileTest, KeyOpenToOthersIsRefusedAndKept) {
  ASSERT_TRUE(EkSandboxFileKeySource(keyPath()).key().ok());
  for (mode_t mode : {0644, 0640, 0604, 0620, 0602}) {
    ASSERT_EQ(chmod(keyPath().c_str(), mode), 0);
    Result<EkSandboxKey> key = EkSandboxFileKeySource(keyPath()).key();
    ASSERT_FALSE(key.ok()) << std::oct << mode;
    EXPECT_TRUE(key.error().isPosix(EPERM)) << key.error().message;
  }
  struct stat status;
  ASSERT_EQ(stat(keyPath().c_str(), &status), 0);
  EXPECT_EQ(status.st_size, static_cast<off_t>(kSandboxKeySize));
}

TEST_F(EkSandboxKeyFileTest, KeyOfTheWrongSizeIsRefused) {
  std::filesystem::create_directories(directory_.at("state"));
  for (size_t size : {size_t{0}, size_t{31}, size_t{33}, size_t{4096}}) {
    {
      std::ofstream out(keyPath(), std::ios::binary | std::ios::trunc);
      out << std::string(size, 'k');
    }
    ASSERT_EQ(chmod(keyPath().c_str(), 0600), 0);
    Result<EkSandboxKey> key = EkSandboxFileKeySource(keyPath()).key();
    ASSERT_FALSE(key.ok()) << size;
    EXPECT_TRUE(key.error().isPosix(EINVAL)) << key.error().message;
  }
}

TEST_F(EkSandboxKeyFileTest, KeyThatIsNotARegularFileIsRefused) {
  std::filesystem::create_directories(keyPath());
  Result<EkSandboxKey> directory = EkSandboxFileKeySource(keyPath()).key();
  ASSERT_FALSE(directory.ok());
  EXPECT_TRUE(directory.error().isPosix(EINVAL)) << directory.error().message;
  std::filesystem::remove(keyPath());

  const std::string target = directory_.at("elsewhere.key");
  {
    std::ofstream out(target, std::ios::binary);
    out << std::string(kSandboxKeySize, 'k');
  }
  ASSERT_EQ(chmod(target.c_str(), 0600), 0);
  ASSERT_EQ(symlink(target.c_str(), keyPath().c_str()), 0);
  Result<EkSandboxKey> link = EkSandboxFileKeySource(keyPath()).key();
  ASSERT_FALSE(link.ok());
  EXPECT_TRUE(link.error().isPosix(ELOOP)) << link.error().message;
}

TEST_F(EkSandboxKeyFileTest, UnusableKeyMakesConsumeRefuseAndIssueFail) {
  std::filesystem::create_directories(keyPath());
  EkSandbox sandbox(std::make_shared<EkSandboxFileKeySource>(keyPath()));
  EXPECT_FALSE(sandbox.issueServiceExtension("c", "svc", 0).ok());
  EkSandbox valid(std::make_shared<EkSandboxMemoryKeySource>(keyOf(1)));
  Result<std::string> token = valid.issueServiceExtension("c", "svc", 0);
  ASSERT_TRUE(token.ok());
  errno = 0;
  EXPECT_EQ(sandbox.consume(*token), -1);
  EXPECT_EQ(errno, EINVAL);
}

}  // namespace
}  // namespace ek
