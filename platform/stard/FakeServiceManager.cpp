#include <errno.h>
#include <signal.h>

#include <algorithm>
#include <cstdlib>
#include <iterator>
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
  std::unique_lock lock(mutex_);
  removals_.push_back(Removal{std::string(bundleIdentifier), std::string(version)});
  auto it = answers_.find(bundleIdentifier);
  std::function<void()> post = [queue = std::move(queue), answer = std::move(answer),
                                code = it == answers_.end() ? kNoSuchProcess : it->second] {
    queue->async([answer, code] {
      if (answer) answer(code);
    });
  };
  if (std::find(held_.begin(), held_.end(), bundleIdentifier) != held_.end()) {
    heldAnswers_.push_back(std::move(post));
    return;
  }
  lock.unlock();
  post();
}

Result<pid_t> FakeServiceManager::launch(pid_t, std::string_view, const std::vector<std::string>&) {
  return EkError::posix(ENOTSUP, "the fake service manager launches nothing");
}

std::vector<Instance> FakeServiceManager::instances(const std::vector<std::string>& identifiers) {
  std::lock_guard lock(mutex_);
  std::vector<Instance> result;
  std::copy_if(instances_.begin(), instances_.end(), std::back_inserter(result), [&](auto& one) {
    return std::find(identifiers.begin(), identifiers.end(), one.bundleIdentifier) !=
           identifiers.end();
  });
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
