#include "tests/soak/Child.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>

extern char** environ;

namespace ek::soak {

int decodeStatus(int status) {
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return -1;
}

std::unique_ptr<Child> Child::spawn(const std::vector<std::string>& argv,
                                    const std::map<std::string, std::string>& env,
                                    const std::string& stderrPath) {
  std::map<std::string, std::string> merged;
  for (char** entry = environ; *entry; ++entry) {
    const char* equals = std::strchr(*entry, '=');
    if (!equals) continue;
    merged[std::string(*entry, static_cast<size_t>(equals - *entry))] = equals + 1;
  }
  for (const auto& [key, value] : env) merged[key] = value;
  std::vector<std::string> envText;
  for (const auto& [key, value] : merged) envText.push_back(key + "=" + value);
  std::vector<char*> envp;
  for (auto& text : envText) envp.push_back(text.data());
  envp.push_back(nullptr);
  std::vector<std::string> args = argv;
  std::vector<char*> argp;
  for (auto& arg : args) argp.push_back(arg.data());
  argp.push_back(nullptr);

  int out[2];
  if (pipe2(out, O_CLOEXEC) != 0) return nullptr;
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_adddup2(&actions, out[1], 1);
  posix_spawn_file_actions_addopen(&actions, 2, stderrPath.c_str(), O_WRONLY | O_CREAT | O_APPEND,
                                   0644);
  std::unique_ptr<Child> child(new Child());
  int rc = posix_spawn(&child->pid_, argp[0], &actions, nullptr, argp.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  ::close(out[1]);
  if (rc != 0) {
    ::close(out[0]);
    child->pid_ = -1;
    child->reaped_ = true;
    return nullptr;
  }
  int readFd = out[0];
  child->reader_ = std::thread([raw = child.get(), readFd] { raw->readLoop(readFd); });
  return child;
}

void Child::readLoop(int fd) {
  char buffer[4096];
  for (;;) {
    ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    std::lock_guard lock(mutex_);
    // Bounded: what a child prints here is a handful of lines (ekbench's one JSON object).
    if (out_.size() < (16u << 20)) out_.append(buffer, static_cast<size_t>(n));
    changed_.notify_all();
  }
  ::close(fd);
  std::lock_guard lock(mutex_);
  closed_ = true;
  changed_.notify_all();
}

Child::~Child() {
  if (!reaped_) kill9();
  if (reader_.joinable()) reader_.join();
}

std::optional<std::string> Child::waitForLine(const std::string& prefix,
                                              std::chrono::milliseconds timeout) {
  std::unique_lock lock(mutex_);
  auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    size_t start = 0;
    for (size_t end; (end = out_.find('\n', start)) != std::string::npos; start = end + 1) {
      if (out_.compare(start, prefix.size(), prefix) == 0) {
        return out_.substr(start, end - start);
      }
    }
    if (closed_) return std::nullopt;
    if (changed_.wait_until(lock, deadline) == std::cv_status::timeout) return std::nullopt;
  }
}

std::string Child::output() {
  std::lock_guard lock(mutex_);
  return out_;
}

int Child::kill9() {
  if (reaped_) return status_;
  ::kill(pid_, SIGKILL);
  int status = 0;
  while (waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
  }
  reaped_ = true;
  status_ = decodeStatus(status);
  if (reader_.joinable()) reader_.join();
  return status_;
}

std::optional<int> Child::wait(std::chrono::milliseconds timeout) {
  if (reaped_) return status_;
  auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    int status = 0;
    pid_t done = waitpid(pid_, &status, WNOHANG);
    if (done == pid_) {
      reaped_ = true;
      status_ = decodeStatus(status);
      if (reader_.joinable()) reader_.join();
      return status_;
    }
    if (std::chrono::steady_clock::now() >= deadline) return std::nullopt;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
}

}  // namespace ek::soak
