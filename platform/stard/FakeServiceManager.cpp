#include <errno.h>
#include <signal.h>

#include <algorithm>
#include <cstdlib>
#include <utility>

#include "platform/stard/ServiceManager.h"

namespace ek::stard {

int FakeServiceManager::addExternalService(pid_t hostPid, std::string_view hostPath,
                                           std::string_view bundleIdentifier,
                                           std::string_view program, const Dictionary& overlay) {
  std::lock_guard lock(mutex_);
  declarations_.push_back(Declaration{hostPid, std::string(hostPath), std::string(bundleIdentifier),
                                      std::string(program), overlay});
  return addResult;
}

void FakeServiceManager::pruneDeclarations() {
  std::lock_guard lock(mutex_);
  std::erase_if(declarations_, [](const Declaration& declaration) {
    return ::kill(declaration.hostPid, 0) != 0 && errno == ESRCH;
  });
}

void FakeServiceManager::removeExternalService(std::string_view bundleIdentifier,
                                               std::string_view version,
                                               std::shared_ptr<SerialQueue> queue,
                                               std::function<void(int)> answer) {
  if (!queue) std::abort();  // an answer with nowhere to go is a caller's broken invariant
  auto post = [queue = std::move(queue), answer = std::move(answer)](int code) {
    queue->async([answer, code] {
      if (answer) answer(code);
    });
  };
  int code = kNoSuchProcess;
  {
    std::lock_guard lock(mutex_);
    removals_.push_back(Removal{std::string(bundleIdentifier), std::string(version)});
    if (auto it = answers_.find(bundleIdentifier); it != answers_.end()) code = it->second;
    if (std::find(held_.begin(), held_.end(), bundleIdentifier) != held_.end()) {
      heldAnswers_.push_back([post, code] { post(code); });
      return;
    }
  }
  post(code);
}

Result<pid_t> FakeServiceManager::launch(pid_t, std::string_view, const std::vector<std::string>&) {
  return EkError::posix(ENOTSUP, "the fake service manager launches nothing");
}

std::vector<Instance> FakeServiceManager::instances(
    const std::vector<std::string>& bundleIdentifiers) {
  std::lock_guard lock(mutex_);
  std::vector<Instance> result;
  for (const Instance& instance : instances_) {
    if (std::find(bundleIdentifiers.begin(), bundleIdentifiers.end(), instance.bundleIdentifier) !=
        bundleIdentifiers.end()) {
      result.push_back(instance);
    }
  }
  return result;
}

void FakeServiceManager::setRemovalAnswer(std::string bundleIdentifier, int answer) {
  std::lock_guard lock(mutex_);
  answers_[std::move(bundleIdentifier)] = answer;
}

void FakeServiceManager::holdAnswers(std::string bundleIdentifier) {
  std::lock_guard lock(mutex_);
  held_.push_back(std::move(bundleIdentifier));
}

void FakeServiceManager::releaseHeldAnswers() {
  std::vector<std::function<void()>> answers;
  {
    std::lock_guard lock(mutex_);
    held_.clear();
    answers.swap(heldAnswers_);
  }
  for (auto& answer : answers) answer();
}

void FakeServiceManager::addInstance(Instance instance) {
  std::lock_guard lock(mutex_);
  instances_.push_back(std::move(instance));
}

std::vector<FakeServiceManager::Removal> FakeServiceManager::removals() const {
  std::lock_guard lock(mutex_);
  return removals_;
}

std::vector<FakeServiceManager::Declaration> FakeServiceManager::declarations() const {
  std::lock_guard lock(mutex_);
  return declarations_;
}

}  // namespace ek::stard
