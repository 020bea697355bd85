// ekctl: the command-line client of the plug-in daemon.
#include <fmt/format.h>
#include <poll.h>
#include <signal.h>
#include <sys/signalfd.h>
#include <unistd.h>
#include <CLI/CLI.hpp>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <future>
#include <iostream>
#include <iterator>
#include <optional>
#include <string>
#include <vector>

#include "Ekora/EkDaemonClient.h"
#include "Ekora/EkProtocol.h"
#include "platform/json/WireJson.h"
#include "platform/log/Log.h"
#include "platform/notify/Notifications.h"
#include "platform/prefs/Preferences.h"
#include "tools/ekctl/Output.h"

namespace {

using namespace ek;

enum Exit { kSuccess = 0, kReplyError = 1, kUsage = 2, kTransport = 3 };

constexpr std::string_view kPointKey = "ZuExtensionPointIdentifier";
constexpr std::string_view kElectionKey = "ZuUserElection";

struct Options {
  std::string service{protocol::kServiceName};
  bool json = false;
  // "table", "json" or "wire"; empty: a table on a terminal, wire JSON otherwise.
  std::string output;
  int timeoutSeconds = 30;
};

// Which instance to reach: a user's own (the default for every user but root) or the
// system's. Either overrides EKORA_RUNTIME_DIR and EKORA_STATE_DIR for this process.
void chooseInstance(bool user, bool system) {
  if (system) {
    ::setenv("EKORA_RUNTIME_DIR", "/run/ekora", 1);
    ::setenv("EKORA_STATE_DIR", "/var/lib/ekora", 1);
    return;
  }
  if (!user) return;
  const char* runtime = std::getenv("XDG_RUNTIME_DIR");
  std::string runtimeDir = runtime && *runtime == '/' ? std::string(runtime) + "/ekora"
                                                      : fmt::format("/tmp/ekora-{}", ::getuid());
  ::setenv("EKORA_RUNTIME_DIR", runtimeDir.c_str(), 1);
  const char* state = std::getenv("XDG_STATE_HOME");
  const char* home = std::getenv("HOME");
  if (state && *state == '/') {
    ::setenv("EKORA_STATE_DIR", (std::string(state) + "/ekora").c_str(), 1);
  } else if (home && *home == '/') {
    ::setenv("EKORA_STATE_DIR", (std::string(home) + "/.local/state/ekora").c_str(), 1);
  }
}

[[noreturn]] void usageError(const std::string& message) {
  std::fprintf(stderr, "ekctl: %s\n", message.c_str());
  std::exit(kUsage);
}

Value parseJsonArgument(const std::string& text, std::string_view what) {
  auto value = wirejson::parse(text);
  if (!value) usageError(fmt::format("{} is not valid JSON: {}", what, value.error().message));
  return std::move(value).value();
}

Dictionary parseJsonDictionary(const std::string& text, std::string_view what) {
  Value value = parseJsonArgument(text, what);
  if (!value.dictionary()) usageError(fmt::format("{} must be a JSON object", what));
  return std::move(*value.dictionary());
}

Uuid parseUuid(const std::string& text) {
  auto uuid = Uuid::parse(text);
  if (!uuid) usageError(fmt::format("not a UUID: {}", text));
  return *uuid;
}

std::vector<EkDaemonClient::PlugInRef> parsePlugInRefs(const std::vector<std::string>& args) {
  std::vector<EkDaemonClient::PlugInRef> refs;
  for (const std::string& arg : args) {
    auto equals = arg.find('=');
    EkDaemonClient::PlugInRef ref{parseUuid(arg.substr(0, equals)), std::nullopt};
    if (equals != std::string::npos) ref.path = arg.substr(equals + 1);
    refs.push_back(std::move(ref));
  }
  return refs;
}

// Paths are sent absolute, as the daemon requires; a relative one is taken from here.
std::vector<std::string> absolutePaths(const std::vector<std::string>& paths) {
  std::vector<std::string> result;
  std::string cwd;
  for (const std::string& path : paths) {
    if (!path.empty() && path[0] == '/') {
      result.push_back(path);
      continue;
    }
    if (cwd.empty()) {
      char buffer[4096];
      if (!getcwd(buffer, sizeof buffer)) usageError("cannot determine the current directory");
      cwd = buffer;
    }
    result.push_back(cwd + "/" + path);
  }
  return result;
}

std::string executablePath() {
  char buffer[4096];
  ssize_t n = ::readlink("/proc/self/exe", buffer, sizeof buffer - 1);
  return n > 0 ? std::string(buffer, static_cast<size_t>(n)) : std::string("ekctl");
}

using Sender = std::function<void(EkDaemonClient&, EkDaemonClient::Reply)>;
// Turns a successful reply into what the command shows, or into an error.
using Shaper = std::function<Result<Value>(Value)>;

// Sends one request and waits for its reply.
std::optional<Result<Value>> exchange(const Options& options, const Sender& sender,
                                      std::shared_ptr<EkDaemonClient>* keep = nullptr) {
  auto client = EkDaemonClient::initWithServiceName(options.service);
  if (keep) *keep = client;
  auto promise = std::make_shared<std::promise<Result<Value>>>();
  auto future = promise->get_future();
  sender(*client, [promise](Result<Value> reply) { promise->set_value(std::move(reply)); });
  if (future.wait_for(std::chrono::seconds(options.timeoutSeconds)) != std::future_status::ready) {
    return std::nullopt;
  }
  return future.get();
}

int run(const Options& options, std::string_view command, const Sender& sender,
        std::shared_ptr<EkDaemonClient>* keep = nullptr, const Shaper& shape = nullptr) {
  auto reply = exchange(options, sender, keep);
  if (!reply) {
    std::fprintf(stderr, "ekctl: no reply from %s within %d s\n", options.service.c_str(),
                 options.timeoutSeconds);
    return kTransport;
  }
  if (!*reply) {
    std::fprintf(stderr, "ekctl: cannot reach %s: %s\n", options.service.c_str(),
                 reply->error().message.c_str());
    return kTransport;
  }
  Value body = std::move(*reply).value();
  if (command == "raw") {
    std::cout << wirejson::write(body) << "\n";
    return kSuccess;
  }
  std::string format = options.output;
  if (format.empty()) format = options.json || !isatty(STDOUT_FILENO) ? "wire" : "table";
  auto error = EkDaemonClient::errorInReply(body);
  if (!error && shape) {
    auto shaped = shape(std::move(body));
    if (!shaped) {
      error = shaped.error();
      body = Value(Dictionary{{std::string(protocol::kErrorCode), Value(error->code)},
                              {std::string(protocol::kError), Value(error->message)}});
    } else {
      body = std::move(shaped).value();
    }
  }
  if (error) {
    if (format == "wire") std::cout << wirejson::write(body) << "\n";
    if (format == "json") std::cout << ekctl::replyAsPlainJson(command, body);
    std::fprintf(stderr, "ekctl: error %d: %s\n", error->code, error->message.c_str());
    if (auto hint = ekctl::nextStep(command, *error, executablePath())) {
      std::fprintf(stderr, "ekctl: %s\n", hint->c_str());
    }
    return kReplyError;
  }
  if (format == "wire") {
    std::cout << ekctl::replyAsJson(body);
  } else if (format == "json") {
    std::cout << ekctl::replyAsPlainJson(command, body);
  } else {
    std::cout << ekctl::replyAsTable(command, body);
  }
  return kSuccess;
}

// Prints "NAME GENERATION" per post until SIGINT or SIGTERM, which end it successfully.
int watch(const std::vector<std::string>& names) {
  for (const std::string& name : names) {
    if (auto valid = notify::checkName(name); !valid) {
      usageError(
          fmt::format("watch: invalid notification name \"{}\": {}", name, valid.error().message));
    }
  }
  // The signals arrive on a descriptor polled beside the watcher, so a post and a signal
  // never race and the output already flushed stays complete.
  sigset_t stopSignals;
  sigemptyset(&stopSignals);
  sigaddset(&stopSignals, SIGINT);
  sigaddset(&stopSignals, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
  int signalFd = signalfd(-1, &stopSignals, SFD_CLOEXEC | SFD_NONBLOCK);
  if (signalFd < 0) {
    std::fprintf(stderr, "ekctl: watch: signalfd: %s\n", std::strerror(errno));
    return kTransport;
  }
  auto watcher = notify::Watcher::create(names);
  if (!watcher) {
    std::fprintf(stderr, "ekctl: watch: %s\n", watcher.error().message.c_str());
    return kTransport;
  }
  while (true) {
    struct pollfd fds[2] = {{(*watcher)->fd(), POLLIN, 0}, {signalFd, POLLIN, 0}};
    if (poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      std::fprintf(stderr, "ekctl: watch: poll: %s\n", std::strerror(errno));
      return kTransport;
    }
    if (fds[1].revents != 0) return kSuccess;
    if (fds[0].revents == 0) continue;
    auto entries = (*watcher)->next(std::chrono::milliseconds(0));
    if (!entries) {
      std::fprintf(stderr, "ekctl: watch: %s\n", entries.error().message.c_str());
      return kTransport;
    }
    for (const auto& [name, generation] : *entries) {
      std::fprintf(stdout, "%s %llu\n", name.c_str(), static_cast<unsigned long long>(generation));
      if (std::fflush(stdout) != 0) return kTransport;
    }
  }
}

struct DefaultsArguments {
  std::string domain;
  std::string key;
  bool hasKey = false;
  std::string json;
};

// The current user's preferences domains, edited in place: no daemon is involved.
int defaults(std::string_view action, const DefaultsArguments& args) {
  if (auto valid = prefs::checkDomainName(args.domain); !valid) {
    usageError(fmt::format("defaults: {}", valid.error().message));
  }
  std::optional<Value> newValue;
  if (action == "write") newValue = parseJsonArgument(args.json, "the value");

  auto opened = prefs::PreferencesDomain::open(args.domain);
  if (!opened) {
    std::fprintf(stderr, "ekctl: defaults: %s\n", opened.error().message.c_str());
    return kReplyError;
  }
  prefs::PreferencesDomain& domain = **opened;
  const auto fail = [&](const std::string& message) {
    std::fprintf(stderr, "ekctl: defaults %.*s: %s\n", static_cast<int>(action.size()),
                 action.data(), message.c_str());
    return kReplyError;
  };

  if (action == "write") {
    if (auto written = domain.set(args.key, std::move(*newValue)); !written) {
      return fail(written.error().message);
    }
    return kSuccess;
  }
  if (auto error = domain.readError()) return fail(error->message);
  if (!domain.exists()) return fail(fmt::format("domain {} does not exist", args.domain));
  std::optional<Value> value = args.hasKey ? domain.value(args.key) : Value(domain.dictionary());
  if (!value) {
    return fail(fmt::format("key \"{}\" does not exist in domain {}", args.key, args.domain));
  }
  if (action == "read") {
    std::cout << wirejson::write(*value, isatty(STDOUT_FILENO)) << "\n";
    return kSuccess;
  }
  auto removed = args.hasKey ? domain.remove(args.key) : domain.removeAll();
  if (!removed) return fail(removed.error().message);
  return kSuccess;
}

}  // namespace

int main(int argc, char** argv) {
  // The client library's own lines would only interleave with the replies; EKORA_LOG still
  // turns them on.
  if (!std::getenv("EKORA_LOG")) log::configure("error");
  Options options;
  CLI::App app{"ekctl: query and manage the plug-in daemon"};
  app.require_subcommand(1);
  // Options of ekctl itself may follow the command as well as precede it.
  app.fallthrough();
  app.set_version_flag("--version", std::string("ekctl ") + EKORA_VERSION);
  app.add_option("-S", options.service, "service name of the daemon");
  app.add_flag("--json", options.json, "print replies as wire JSON (the same as -o wire)");
  app.add_option("-o,--output", options.output,
                 "table, json (plain JSON for tools such as jq) or wire (wire JSON)")
      ->check(CLI::IsMember({"table", "json", "wire"}));
  app.add_option("--timeout", options.timeoutSeconds, "seconds to wait for a reply (1 to 3600)")
      ->check(CLI::Range(1, 3600).description(""));
  bool userInstance = false, systemInstance = false;
  auto* userFlag = app.add_flag("--user", userInstance,
                                "reach the calling user's own ekd (the default but for root)");
  app.add_flag("--system", systemInstance, "reach the system's ekd (the default for root)")
      ->excludes(userFlag);

  std::string rawJson, rulesJson, envJson, setJson, annotationsJson, uuidText, urlText;
  std::vector<std::string> paths, refs, uuidTexts;
  uint64_t flags = 0;

  auto* raw = app.add_subcommand("raw", "send one request in wire JSON (argument or stdin)");
  raw->add_option("JSON", rawJson);
  auto* add = app.add_subcommand("add", "register plug-in or application bundles");
  add->add_option("PATH", paths)->required();
  auto* remove = app.add_subcommand("remove", "unregister plug-in or application bundles");
  remove->add_option("PATH", paths)->required();
  auto* bulk = app.add_subcommand("bulk", "the \"bulk\" request");
  bulk->add_option("--flags", flags);
  auto* match = app.add_subcommand("match", "discover plug-ins matching rules");
  match->add_option("--flags", flags);
  match->add_option("RULES", rulesJson, "a JSON dictionary of attribute rules");
  std::string pointFilter, appFilter, infoTarget;
  bool electedOnly = false;
  auto* list = app.add_subcommand("list", "list the plug-ins this client may discover");
  list->add_option("--point", pointFilter, "only plug-ins of this extension point");
  list->add_option("--app", appFilter, "only plug-ins inside this application bundle");
  list->add_flag("--elected", electedOnly, "only plug-ins the user elected");
  list->add_option("--flags", flags);
  auto* info = app.add_subcommand("info", "show one plug-in");
  info->add_option("PLUGIN", infoTarget, "a plug-in's identifier, UUID or bundle path")->required();
  auto* status = app.add_subcommand("status", "show the daemon's version, process and counts");
  auto* rescan = app.add_subcommand(
      "rescan", "have the daemon register the system volume's plug-ins as they are now");
  auto* find = app.add_subcommand("find", "look one plug-in up");
  auto* findUuid = find->add_option("--uuid", uuidText);
  auto* findUrl = find->add_option("--url", urlText);
  findUuid->excludes(findUrl);
  auto* ready = app.add_subcommand("ready", "make plug-ins ready to launch");
  ready->add_option("--flags", flags);
  ready->add_option("--env", envJson, "environment as a JSON dictionary");
  ready->add_option("UUID[=PATH]", refs)->required();
  auto* access = app.add_subcommand("access", "obtain read-only extensions to plug-in bundles");
  access->add_option("--flags", flags);
  access->add_option("UUID[=PATH]", refs)->required();
  auto* annotate = app.add_subcommand("annotate", "change plug-ins' annotations");
  annotate->add_option("--set", setJson, "annotations as a JSON dictionary")->required();
  annotate->add_option("UUID", uuidTexts)->required();
  auto* bulkAnnotate = app.add_subcommand("bulk-annotate", "change annotations in bulk");
  bulkAnnotate->add_option("JSON", annotationsJson)->required();
  auto* hold = app.add_subcommand(
      "hold", "hold the plug-ins of bundles until interrupted (SIGINT or SIGTERM releases them)");
  hold->add_option("--flags", flags);
  hold->add_option("PATH", paths)->required();
  auto* release = app.add_subcommand("release", "release a hold");
  release->add_option("UUID", uuidText)->required();
  std::vector<std::string> notificationNames;
  auto* watchCommand = app.add_subcommand("watch", "print notifications as they are posted");
  watchCommand->add_option("NAME", notificationNames, "notification names")->required();
  DefaultsArguments defaultsArgs;
  auto* defaultsCommand =
      app.add_subcommand("defaults", "read and write the current user's preferences domains");
  defaultsCommand->require_subcommand(1);
  auto* defaultsRead = defaultsCommand->add_subcommand("read", "print a domain or one value");
  defaultsRead->add_option("DOMAIN", defaultsArgs.domain)->required();
  auto* readKey = defaultsRead->add_option("KEY", defaultsArgs.key);
  auto* defaultsWrite = defaultsCommand->add_subcommand("write", "set one value, given as JSON");
  defaultsWrite->add_option("DOMAIN", defaultsArgs.domain)->required();
  defaultsWrite->add_option("KEY", defaultsArgs.key)->required();
  defaultsWrite->add_option("JSON", defaultsArgs.json)->required();
  auto* defaultsDelete = defaultsCommand->add_subcommand("delete", "remove a value or all of them");
  defaultsDelete->add_option("DOMAIN", defaultsArgs.domain)->required();
  auto* deleteKey = defaultsDelete->add_option("KEY", defaultsArgs.key);

  try {
    app.parse(argc, argv);
  } catch (const CLI::CallForHelp& e) {
    return app.exit(e);
  } catch (const CLI::CallForAllHelp& e) {
    return app.exit(e);
  } catch (const CLI::CallForVersion& e) {
    return app.exit(e);
  } catch (const CLI::ParseError& e) {
    app.exit(e);
    return kUsage;
  }

  chooseInstance(userInstance, systemInstance);

  if (raw->parsed()) {
    if (rawJson.empty()) {
      rawJson.assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
    }
    Dictionary message = parseJsonDictionary(rawJson, "the request");
    return run(options, "raw", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
      c.send(std::move(message), std::move(r));
    });
  }
  if (add->parsed() || remove->parsed()) {
    bool adding = add->parsed();
    auto absolute = absolutePaths(paths);
    return run(options, adding ? "add" : "remove", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
      adding ? c.addPlugIns(absolute, std::move(r)) : c.removePlugIns(absolute, std::move(r));
    });
  }
  if (bulk->parsed()) {
    return run(options, "bulk", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
      c.bulkPlugins(flags, std::move(r));
    });
  }
  if (match->parsed()) {
    Dictionary rules = rulesJson.empty() ? Dictionary{} : parseJsonDictionary(rulesJson, "RULES");
    return run(options, "match", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
      c.matchPlugIns(rules, flags, std::move(r));
    });
  }
  if (list->parsed()) {
    Dictionary rules;
    if (!pointFilter.empty()) rules.emplace(kPointKey, pointFilter);
    if (electedOnly) rules.emplace(kElectionKey, "1");
    std::string prefix;
    if (!appFilter.empty()) prefix = absolutePaths({appFilter}).front() + "/";
    Shaper shape = [prefix](Value reply) -> Result<Value> {
      return ekctl::keepPlugIns(std::move(reply), [&](const Value& form) {
        const std::string* path = form.getString("path");
        return prefix.empty() || (path && path->starts_with(prefix));
      });
    };
    return run(
        options, "match",
        [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
          c.matchPlugIns(rules, flags, std::move(r));
        },
        nullptr, shape);
  }
  if (info->parsed()) {
    if (auto uuid = Uuid::parse(infoTarget)) {
      return run(options, "find", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
        c.findPlugInByUUID(*uuid, std::move(r));
      });
    }
    if (infoTarget.find('/') != std::string::npos || infoTarget.starts_with(".")) {
      std::string url = ekctl::urlArgument(infoTarget);
      return run(options, "find", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
        c.findPlugInByPathURL(url, std::move(r));
      });
    }
    Shaper shape = [&](Value reply) { return ekctl::onePlugInNamed(std::move(reply), infoTarget); };
    return run(
        options, "find",
        [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
          c.matchPlugIns(Dictionary{}, flags, std::move(r));
        },
        nullptr, shape);
  }
  if (status->parsed() || rescan->parsed()) {
    Dictionary message{{std::string(protocol::kRequest), Value(protocol::kStatus)},
                       {std::string(protocol::kVersion), Value(protocol::kCurrentVersion)}};
    if (status->parsed()) {
      return run(options, "status", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
        c.send(std::move(message), std::move(r));
      });
    }
    // The daemon rescans on SIGHUP, as systemctl reload asks it to; its status names it.
    Shaper signal = [](Value reply) -> Result<Value> {
      const uint64_t* pid = reply.getUnsigned("pid");
      if (!pid || *pid == 0 || *pid > INT32_MAX) {
        return EkError::ekora(protocol::kErrorInvalidRequest, "the daemon did not say its pid");
      }
      if (::kill(static_cast<pid_t>(*pid), SIGHUP) != 0) {
        return EkError::posix(errno, fmt::format("cannot signal the daemon (pid {}): {}", *pid,
                                                 std::strerror(errno)));
      }
      return Value(Dictionary{});
    };
    return run(
        options, "rescan",
        [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
          c.send(std::move(message), std::move(r));
        },
        nullptr, signal);
  }
  if (find->parsed()) {
    if (uuidText.empty() == urlText.empty()) usageError("find takes one of --uuid or --url");
    if (!uuidText.empty()) {
      Uuid uuid = parseUuid(uuidText);
      return run(options, "find", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
        c.findPlugInByUUID(uuid, std::move(r));
      });
    }
    std::string url = ekctl::urlArgument(urlText);
    return run(options, "find", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
      c.findPlugInByPathURL(url, std::move(r));
    });
  }
  if (ready->parsed()) {
    auto plugIns = parsePlugInRefs(refs);
    std::optional<Dictionary> environment;
    if (!envJson.empty()) environment = parseJsonDictionary(envJson, "--env");
    return run(options, "ready", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
      c.readyPlugIns(plugIns, flags, environment, std::move(r));
    });
  }
  if (access->parsed()) {
    auto plugIns = parsePlugInRefs(refs);
    return run(options, "access", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
      c.accessPlugIns(plugIns, flags, std::move(r));
    });
  }
  if (annotate->parsed()) {
    Dictionary annotations = parseJsonDictionary(setJson, "--set");
    std::vector<Uuid> uuids;
    for (const auto& text : uuidTexts) uuids.push_back(parseUuid(text));
    return run(options, "annotate", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
      c.setPluginAnnotations(uuids, annotations, std::move(r));
    });
  }
  if (bulkAnnotate->parsed()) {
    Dictionary annotations = parseJsonDictionary(annotationsJson, "JSON");
    return run(options, "bulk-annotate", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
      c.bulkSetPluginAnnotations(annotations, std::move(r));
    });
  }
  if (hold->parsed()) {
    auto absolute = absolutePaths(paths);
    // A hold lasts as long as the connection that placed it: keep it open until interrupted.
    std::shared_ptr<EkDaemonClient> connection;
    int status = run(
        options, "hold",
        [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
          c.holdPlugins(absolute, flags, std::move(r));
        },
        &connection);
    if (status != kSuccess) return status;
    std::cout.flush();
    ::signal(SIGINT, [](int) { _exit(kSuccess); });
    ::signal(SIGTERM, [](int) { _exit(kSuccess); });
    for (;;) ::pause();
  }
  if (release->parsed()) {
    Uuid uuid = parseUuid(uuidText);
    return run(options, "release", [&](EkDaemonClient& c, EkDaemonClient::Reply r) {
      c.releaseHold(uuid, std::move(r));
    });
  }
  if (watchCommand->parsed()) return watch(notificationNames);
  if (defaultsCommand->parsed()) {
    if (defaultsRead->parsed()) {
      defaultsArgs.hasKey = readKey->count() > 0;
      return defaults("read", defaultsArgs);
    }
    if (defaultsWrite->parsed()) return defaults("write", defaultsArgs);
    defaultsArgs.hasKey = deleteKey->count() > 0;
    return defaults("delete", defaultsArgs);
  }
  return kUsage;
}
