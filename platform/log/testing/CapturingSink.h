#pragma once

#include <functional>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/log/Log.h"

// For tests: a log sink that keeps every record it is given, for assertions on what was
// logged. Records may arrive from any thread.
namespace ek::log::testing {

class CapturingSink : public Sink {
 public:
  struct Line {
    Level level;
    std::string category;
    std::string message;
  };

  void write(const Record& record) override {
    std::lock_guard lock(mutex_);
    lines_.push_back({record.level, std::string(record.category), std::string(record.message)});
  }
  std::vector<Line> lines() const {
    std::lock_guard lock(mutex_);
    return lines_;
  }
  void clear() {
    std::lock_guard lock(mutex_);
    lines_.clear();
  }
  int countIf(const std::function<bool(const Line&)>& predicate) const {
    std::lock_guard lock(mutex_);
    int n = 0;
    for (const Line& line : lines_) n += predicate(line);
    return n;
  }
  int count(Level level, std::string_view category, std::string_view message) const {
    return countIf([&](const Line& line) {
      return line.level == level && line.category == category && line.message == message;
    });
  }
  bool has(Level level, std::string_view category, std::string_view message) const {
    return count(level, category, message) > 0;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<Line> lines_;
};

}  // namespace ek::log::testing
