#include "tools/ekctl/Output.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <vector>

#include "Ekora/EkFileURL.h"
#include "Ekora/EkProtocol.h"
#include "platform/json/WireJson.h"

namespace ek::ekctl {
namespace {

std::string cell(const Value* value) {
  if (!value) return "-";
  if (const std::string* text = value->string()) return *text;
  if (const Uuid* uuid = value->uuid()) return uuid->string();
  return wirejson::write(*value);
}

std::string table(const std::vector<std::string>& headers,
                  const std::vector<std::vector<std::string>>& rows) {
  std::vector<size_t> widths(headers.size());
  for (size_t c = 0; c < headers.size(); ++c) widths[c] = headers[c].size();
  for (const auto& row : rows) {
    for (size_t c = 0; c < row.size(); ++c) widths[c] = std::max(widths[c], row[c].size());
  }
  auto line = [&](const std::vector<std::string>& cells) {
    std::string out;
    for (size_t c = 0; c < cells.size(); ++c) {
      out += c + 1 == cells.size() ? cells[c] : fmt::format("{:<{}}  ", cells[c], widths[c]);
    }
    return out + "\n";
  };
  std::string out = line(headers);
  for (const auto& row : rows) out += line(row);
  return out;
}

std::string keyValues(const Dictionary& dictionary) {
  size_t width = 0;
  for (const auto& [key, value] : dictionary) width = std::max(width, key.size());
  std::string out;
  for (const auto& [key, value] : dictionary) {
    out += fmt::format("{:<{}}  {}\n", key, width, cell(&value));
  }
  return out;
}

}  // namespace

std::string replyAsJson(const Value& reply) {
  return wirejson::write(reply, true) + "\n";
}

std::string replyAsTable(std::string_view command, const Value& reply) {
  const Dictionary* body = reply.dictionary();
  if (!body || body->empty()) return "ok\n";
  const Value* matches = reply.get(protocol::kMatches);
  if (command == "match" && matches && matches->array()) {
    std::vector<std::vector<std::string>> rows;
    for (const Value& form : *matches->array()) {
      rows.push_back({cell(form.get("identifier")), cell(form.get("version")),
                      cell(form.get("uuid")), cell(form.get("path"))});
    }
    std::string out = table({"IDENTIFIER", "VERSION", "UUID", "PATH"}, rows);
    return out + fmt::format("{} plug-in{}\n", rows.size(), rows.size() == 1 ? "" : "s");
  }
  if (command == "find" && matches && matches->dictionary()) {
    return keyValues(*matches->dictionary());
  }
  return keyValues(*body);
}

std::string replyAsPlainJson(std::string_view command, const Value& reply) {
  const Dictionary* body = reply.dictionary();
  if (!body || body->empty()) return "{\n  \"ok\": true\n}\n";
  if (const Value* code = reply.get(protocol::kErrorCode)) {
    Dictionary error{{"code", *code}};
    if (const Value* message = reply.get(protocol::kError)) error.emplace("message", *message);
    return wirejson::writePlain(Value(Dictionary{{"error", Value(std::move(error))}}), true) + "\n";
  }
  const Value* matches = reply.get(protocol::kMatches);
  bool plugIns = command == "match" || command == "list" || command == "find" || command == "info";
  if (plugIns && matches) return wirejson::writePlain(*matches, true) + "\n";
  return wirejson::writePlain(reply, true) + "\n";
}

Result<Value> keepPlugIns(Value reply, const std::function<bool(const Value& form)>& keep) {
  Dictionary* body = reply.dictionary();
  auto it = body ? body->find(protocol::kMatches) : Dictionary::iterator{};
  if (!body || it == body->end() || !it->second.array()) {
    return EkError::ekora(protocol::kErrorInvalidRequest, "the reply holds no list of plug-ins");
  }
  Array& forms = *it->second.array();
  std::erase_if(forms, [&](const Value& form) { return !keep(form); });
  return reply;
}

Result<Value> onePlugInNamed(Value reply, const std::string& identifier) {
  auto kept = EK_TRY(keepPlugIns(std::move(reply), [&](const Value& form) {
    const std::string* name = form.getString("identifier");
    return name && *name == identifier;
  }));
  Array& forms = *kept.dictionary()->at(std::string(protocol::kMatches)).array();
  if (forms.empty()) {
    return EkError::ekora(protocol::kErrorInvalidRequest,
                          fmt::format("no plug-in with identifier {} is visible to this client; "
                                      "try its UUID or bundle path",
                                      identifier));
  }
  Value found = std::move(forms.back());
  forms.clear();
  Dictionary shaped;
  shaped.emplace(protocol::kMatches, std::move(found));
  return Value(std::move(shaped));
}

std::optional<std::string> nextStep(std::string_view command, const EkError& error,
                                    const std::string& executable) {
  if (command == "add" && error.code == protocol::kErrorRegistry) {
    return std::string(
        "the daemon's log names the file and what is wrong with it (journalctl --user -u ekd, "
        "or the daemon's standard error)");
  }
  if (error.code != protocol::kErrorNotPermitted) return std::nullopt;
  if (command != "remove" && command != "match" && command != "list") return std::nullopt;
  return fmt::format(
      "this needs the entitlement {} of the calling program: a dmap dictionary in {}.entitlements "
      "with that key set to true, owned by root or by the daemon's user and writable by nobody "
      "else (the daemon's log says why a file was refused)",
      protocol::kEntitlementManager, executable);
}

std::string urlArgument(const std::string& text) {
  if (text.find("://") != std::string::npos || text.rfind("file:", 0) == 0) return text;
  std::string path = text;
  if (path.empty() || path[0] != '/') {
    char buffer[4096];
    if (getcwd(buffer, sizeof buffer)) path = std::string(buffer) + "/" + path;
  }
  auto url = fileURLFromPath(path);
  return url ? url.value() : text;
}

}  // namespace ek::ekctl
