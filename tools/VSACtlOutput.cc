#include "VSACtlOutput.h"

#include <algorithm>

#include "base/VSAFormat.h"
#include "base/VSAJSON.h"
#include "base/VSAProgressLog.h"

namespace {
const VSAValue::Array& array(const VSAValue& reply, const char* key) {
  static const VSAValue::Array empty;
  const VSAValue* a = reply.get(key);
  return a && a->arrayValue() ? *a->arrayValue() : empty;
}

std::string cell(const VSAValue::Array& column, size_t row) {
  if (row >= column.size()) return "-";
  const VSAValue& v = column[row];
  if (v.uuidValue()) return v.uuidValue()->string();
  if (v.stringValue()) return *v.stringValue();
  return v.isNull() ? "-" : VSAJSON::print(v, false);
}
}  // namespace

// The list reply's parallel arrays, one container per row, by identifier.
std::string VSACtlOutput::containerTable(const VSAValue& reply) {
  const auto& ids = array(reply, "ReplyIdsArray");
  const auto& uuids = array(reply, "ReplyUUIDsArray");
  const auto& personas = array(reply, "ReplyPersonaUniqueStringsArray");
  std::vector<size_t> rows(ids.size());
  for (size_t i = 0; i < rows.size(); ++i) rows[i] = i;
  std::sort(rows.begin(), rows.end(),
            [&](size_t a, size_t b) { return cell(ids, a) < cell(ids, b); });
  size_t width = 10;
  for (size_t i : rows) width = std::max(width, cell(ids, i).size());
  std::string row = "%-" + std::to_string(width) + "s  %-36s  %s\n";
  std::string out = VSAFormat(row, "IDENTIFIER", "UUID", "PERSONA");
  for (size_t i : rows) out += VSAFormat(row, cell(ids, i), cell(uuids, i), cell(personas, i));
  out += VSAFormat("%llu container%s\n", static_cast<unsigned long long>(ids.size()),
                   ids.size() == 1 ? "" : "s");
  return out;
}

std::string VSACtlOutput::forPeople(const VSAValue& reply) {
  if (reply.get("ReplyIdsArray")) return containerTable(reply);
  std::string out;
  for (const auto& [key, value] : *reply.dictionaryValue()) {
    if (key == "ReplyError") continue;
    std::string name = key.rfind("Reply", 0) == 0 ? key.substr(5) : key;
    std::string text;
    if (value.uuidValue())
      text = value.uuidValue()->string();
    else if (value.isString())
      text = *value.stringValue();
    else if (key == "ReplyDiskUsage" && value.uint64Value())
      text = VSAFormat("%@ (%llu bytes)", VSAProgressLog::byteCount(*value.uint64Value()),
                       *value.uint64Value());
    else
      text = VSAJSON::print(value, false);
    out += VSAFormat("%-22s %@\n", name + ":", text);
  }
  return out.empty() ? "OK\n" : out;  // a success that carries nothing else
}
