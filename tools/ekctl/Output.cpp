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
