#include "tests/EkdProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <fstream>
#include <random>
#include <thread>

#include "tests/RawClient.h"

namespace ek::test {
namespace fs = std::filesystem;

std::string ekdPath() {
  return EKD_PATH;
}
std::string ekctlPath() {
  return EKCTL_PATH;
}

namespace {

std::string readAll(int fd) {
  std::string out;
  char buffer[65536];
  ssize_t n;
  while ((n = read(fd, buffer, sizeof buffer)) > 0) out.append(buffer, static_cast<size_t>(n));
  return out;
}

int decodeStatus(int status) {
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return -1;
}

}  // namespace

CommandResult runCommand(const std::vector<std::string>& argv,
                         const std::map<std::string, std::string>& env, const std::string& input) {
  int in[2], out[2], err[2];
  if (pipe2(in, O_CLOEXEC) || pipe2(out, O_CLOEXEC) || pipe2(err, O_CLOEXEC)) std::abort();
  pid_t pid = fork();
  if (pid == 0) {
    dup2(in[0], 0);
    dup2(out[1], 1);
    dup2(err[1], 2);
    for (const auto& [key, value] : env) setenv(key.c_str(), value.c_str(), 1);
    std::vector<char*> args;
    for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    execv(args[0], args.data());
    _exit(127);
  }
  close(in[0]);
  close(out[1]);
  close(err[1]);
  if (!input.empty()) {
    ssize_t ignored = write(in[1], input.data(), input.size());
    (void)ignored;
  }
  close(in[1]);
  CommandResult result;
  std::thread errReader([&] { result.err = readAll(err[0]); });
  result.out = readAll(out[0]);
  errReader.join();
  close(out[0]);
  close(err[0]);
  int status = 0;
  waitpid(pid, &status, 0);
  result.status = decodeStatus(status);
  return result;
}

EkdProcess::EkdProcess(std::vector<std::string> extraArgs) : extraArgs_(std::move(extraArgs)) {
  std::random_device random;
  service_ = "com.corvane.ekora.test." + std::to_string(random() % 1000000);
  fs::create_directories(root_.path() / "run");
  fs::create_directories(root_.path() / "state");
  fs::create_directories(root_.path() / "System");
}

EkdProcess::~EkdProcess() {
  if (running()) kill9();
}

std::map<std::string, std::string> EkdProcess::environment() const {
  return {{"EKORA_RUNTIME_DIR", (root_.path() / "run").string()},
          {"EKORA_STATE_DIR", (root_.path() / "state").string()},
          {"EKORA_SYSTEM_ROOT", (root_.path() / "System").string()}};
}

std::string EkdProcess::socketPath() const {
  return (root_.path() / "run" / service_).string();
}

std::string EkdProcess::log() const {
  std::ifstream in(root_.path() / "ekd.log");
  return std::string(std::istreambuf_iterator<char>(in), {});
}

bool EkdProcess::logShows(std::string_view text) const {
  for (int i = 0; i < 500; ++i) {
    if (log().find(text) != std::string::npos) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return false;
}

bool EkdProcess::start() {
  std::string logPath = (root_.path() / "ekd.log").string();
  pid_ = fork();
  if (pid_ == 0) {
    int fd = open(logPath.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    dup2(fd, 2);
    int devnull = open("/dev/null", O_RDWR);
    dup2(devnull, 0);
    dup2(devnull, 1);
    for (const auto& [key, value] : environment()) setenv(key.c_str(), value.c_str(), 1);
    if (!getenv("EKORA_LOG")) setenv("EKORA_LOG", "debug", 1);
    for (const auto& [key, value] : extraEnvironment_) setenv(key.c_str(), value.c_str(), 1);
    unsetenv("JOURNAL_STREAM");
    std::vector<std::string> argv{ekdPath(), "-S", service_};
    argv.insert(argv.end(), extraArgs_.begin(), extraArgs_.end());
    std::vector<char*> args;
    for (auto& a : argv) args.push_back(a.data());
    args.push_back(nullptr);
    execv(args[0], args.data());
    _exit(127);
  }
  // Up once it answers and has registered the system volume.
  const Value status(Dictionary{{"request", Value("status")}, {"version", Value(uint64_t{3})}});
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
  while (std::chrono::steady_clock::now() < deadline) {
    int code;
    if (waitpid(pid_, &code, WNOHANG) == pid_) {
      exitStatus_ = decodeStatus(code);
      pid_ = -1;
      return false;
    }
    auto reply = ask(status, std::chrono::seconds(5));
    const Value* scanning = reply ? reply->get("scanning") : nullptr;
    if (scanning && scanning->boolean() && !*scanning->boolean()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return false;
}

bool EkdProcess::running() const {
  return pid_ > 0;
}

int EkdProcess::terminate() {
  if (pid_ > 0) {
    ::kill(pid_, SIGTERM);
    int status = 0;
    waitpid(pid_, &status, 0);
    pid_ = -1;
    exitStatus_ = decodeStatus(status);
  }
  return exitStatus_;
}

void EkdProcess::kill9() {
  if (pid_ > 0) ::kill(pid_, SIGKILL);
  terminate();
}

CommandResult EkdProcess::ekctl(std::vector<std::string> args, const std::string& input) const {
  args.insert(args.begin(), {ekctlPath(), "-S", service_});
  return runCommand(args, environment(), input);
}

CommandResult EkdProcess::ekctlAs(const std::string& program, std::vector<std::string> args) const {
  args.insert(args.begin(), {program, "-S", service_});
  return runCommand(args, environment());
}

void EkdProcess::setEnvironment(const std::string& name, const std::string& value) {
  extraEnvironment_[name] = value;
}

std::optional<Value> EkdProcess::ask(const Value& request,
                                     std::chrono::milliseconds timeout) const {
  static std::atomic<uint64_t> nextId{1};
  RawClient client(socketPath());
  uint64_t id = nextId++;
  if (!client.connected() || !client.sendMessage(request, id)) return std::nullopt;
  auto frame = client.readFrame(timeout);
  if (!frame || frame->id != id) return std::nullopt;
  return std::move(frame->body);
}

uint64_t EkdProcess::notificationGeneration(std::string_view name) const {
  std::ifstream in(root_.path() / "run" / "notifications" / std::string(name));
  uint64_t generation = 0;
  if (!(in >> generation)) return 0;
  return generation;
}

std::string ekctlWithEntitlements(const fs::path& dir, const std::vector<std::string>& entitlements,
                                  const fs::path& source) {
  fs::create_directories(dir);
  fs::path program = dir / source.filename();
  fs::copy_file(source, program, fs::copy_options::overwrite_existing);
  std::string text = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<dmap version=\"1.0\">\n<dict>\n";
  for (const auto& name : entitlements) text += "\t<key>" + name + "</key>\n\t<true/>\n";
  text += "</dict>\n</dmap>\n";
  std::string path = program.string() + ".entitlements";
  std::ofstream(path) << text;
  chmod(path.c_str(), 0644);
  return program.string();
}

int64_t replyErrorCode(const Value& reply) {
  const uint64_t* code = reply.getUnsigned("errorcode");
  if (code) return static_cast<int32_t>(static_cast<uint32_t>(*code));
  const Value* value = reply.get("errorcode");
  if (value && value->negativeNumber()) return *value->negativeNumber();
  return 0;
}

std::string replyError(const Value& reply) {
  const std::string* text = reply.getString("error");
  return text ? *text : std::string();
}

}  // namespace ek::test
