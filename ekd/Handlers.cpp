#include "ekd/Handlers.h"

#include <chrono>
#include <cstdlib>
#include <unordered_map>
#include <unordered_set>
#include <variant>

#include "Ekora/EkFileURL.h"
#include "Ekora/EkProtocol.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "platform/log/Log.h"

namespace ek {

Reply Reply::failure(int32_t code, std::string_view message) {
  Reply reply;
  reply.error = Error{code, std::string(message)};
  return reply;
}

const RequestHandler* handlerFor(std::string_view type) {
  using namespace handlers;
  static const std::unordered_map<std::string_view, RequestHandler> table{
      {protocol::kAdd, {.start = &addPlugIns}},
      {protocol::kRemove, {.start = &removePlugIns}},
      {protocol::kBulk, {.answer = &bulkPlugIns}},
      {protocol::kMatch, {.answer = &matchPlugIns}},
      {protocol::kReady, {.answer = &readyPlugIns}},
      {protocol::kAccess, {.answer = &accessPlugIns}},
      {protocol::kAnnotate, {.answer = &annotatePlugIns}},
      {protocol::kBulkAnnotate, {.answer = &bulkAnnotatePlugIns}},
      {protocol::kLock, {.start = &lockDownPlugIns}},
      {protocol::kFind, {.answer = &findPlugIn}},
      {protocol::kStatus, {.answer = &reportStatus}},
  };
  auto it = table.find(type);
  return it == table.end() ? nullptr : &it->second;
}

namespace handlers {
namespace {

constexpr std::chrono::milliseconds kPathSliceBudget{10};

struct PathWalk {
  const Array* paths = nullptr;
  size_t next = 0;
  // The texts already passed on, as sent and as resolved: a path sent many times costs one
  // resolution and one step.
  std::unordered_set<std::string> seen;
  PathStep step;
};

// "paths" when it is an array of at most kMaxListEntries; otherwise the failure.
std::variant<const Array*, Reply> pathList(const Request& request) {
  const Array* paths = request.body.getArray(protocol::kPaths);
  if (!paths) return Reply::failure(protocol::kErrorInvalidRequest, protocol::kMsgInvalidFormat);
  if (paths->size() > protocol::kMaxListEntries) {
    return Reply::failure(protocol::kErrorInvalidRequest,
                          log::format(protocol::kMsgTooManyEntries, protocol::kPaths, paths->size(),
                                      protocol::kMaxListEntries));
  }
  return paths;
}

// One path of a walk: nothing also for a path already seen.
Step walkPath(PathWalk& walk, const Value& element) {
  const std::string* path = element.string();
  if (!path) return Reply::failure(protocol::kErrorInvalidRequest, protocol::kMsgInvalidFormat);
  if (path->empty() || (*path)[0] != '/') {
    return Reply::failure(protocol::kErrorBadPath,
                          log::format(protocol::kMsgAbsolutePathRequired, *path));
  }
  if (!walk.seen.insert(*path).second) return std::nullopt;
  if (path->find('\0') == std::string::npos) {
    char* resolved = ::realpath(path->c_str(), nullptr);
    if (resolved) {
      std::string canonical(resolved);
      std::free(resolved);
      if (canonical != *path && !walk.seen.insert(canonical).second) return std::nullopt;
      return walk.step(canonical, true);
    }
  }
  return walk.step(*path, false);
}

void continuePaths(const Request& request, EkDServer& daemon, std::shared_ptr<PathWalk> walk,
                   Respond respond) {
  if (request.client && !request.client->acceptWork()) return;
  const auto deadline = std::chrono::steady_clock::now() + kPathSliceBudget;
  const Array& paths = *walk->paths;
  while (walk->next < paths.size()) {
    if (Step failure = walkPath(*walk, paths[walk->next++])) {
      respond(std::move(*failure));
      return;
    }
    if (walk->next < paths.size() && std::chrono::steady_clock::now() >= deadline) {
      // respond keeps the request and the daemon alive until it has been called.
      daemon.mainQueue()->asyncAfterEvents([&request, &daemon, walk, respond = std::move(respond)] {
        continuePaths(request, daemon, walk, respond);
      });
      return;
    }
  }
  respond(Reply{});
}

}  // namespace

Step forEachPath(const Request& request, const PathStep& step) {
  PathWalk walk;
  auto paths = pathList(request);
  if (Reply* failure = std::get_if<Reply>(&paths)) return std::move(*failure);
  walk.paths = std::get<const Array*>(paths);
  walk.step = step;
  for (const Value& element : *walk.paths) {
    if (Step failure = walkPath(walk, element)) return failure;
  }
  return std::nullopt;
}

void forEachPathInSlices(const Request& request, EkDServer& daemon, PathStep step,
                         Respond respond) {
  auto walk = std::make_shared<PathWalk>();
  auto paths = pathList(request);
  if (Reply* failure = std::get_if<Reply>(&paths)) {
    respond(std::move(*failure));
    return;
  }
  walk->paths = std::get<const Array*>(paths);
  walk->step = std::move(step);
  continuePaths(request, daemon, std::move(walk), std::move(respond));
}

Step forEachListedPlugIn(const Request& request, EkDServer& daemon,
                         const std::function<Step(const std::shared_ptr<EkDPlugIn>&)>& step) {
  const Array* uuids = request.body.getArray(protocol::kUuids);
  if (!uuids)
    return Reply::failure(protocol::kErrorInvalidRequest, "invalid request format (uuid)");
  if (uuids->size() > protocol::kMaxListEntries) {
    return Reply::failure(protocol::kErrorInvalidRequest,
                          log::format(protocol::kMsgTooManyEntries, protocol::kUuids, uuids->size(),
                                      protocol::kMaxListEntries));
  }
  const Array* paths = nullptr;
  if (const Value* value = request.body.get(protocol::kPaths)) {
    if (!value->array()) {
      log::traffic().defaultLevel("Paths present but not an array (ignoring values)");
    } else if (value->array()->size() != uuids->size()) {
      log::traffic().defaultLevel("Paths present but has different count than UUIDs (ignoring)");
    } else {
      paths = value->array();
    }
  }
  EkDatabase& database = daemon.database();
  for (size_t i = 0; i < uuids->size(); ++i) {
    const Uuid* uuid = (*uuids)[i].uuid();
    if (!uuid)
      return Reply::failure(protocol::kErrorInvalidRequest, "invalid request (bad uuid array)");
    auto plugIn = database.findPlugIn(*uuid);
    if (!plugIn && paths) {
      log::traffic().info("Failed to find plugin by %{uuid_t}.16P", *uuid);
      if (const std::string* path = (*paths)[i].string()) {
        log::traffic().info("Looking for plugin %{uuid_t}.16P by path %s", *uuid, *path);
        if (auto url = EkFileURL::fromPath(*path))
          plugIn = database.findPlugInAtPath(url->string());
      }
    }
    if (!plugIn) {
      return Reply::failure(protocol::kErrorInvalidRequest, "no such plugin (uuid not found)");
    }
    if (Step failure = step(plugIn)) return failure;
  }
  return std::nullopt;
}

}  // namespace handlers
}  // namespace ek
