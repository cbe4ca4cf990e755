#include "platform/RetentionPolicy.h"

#include <cmath>
#include <filesystem>
#include <fstream>
#include <vector>

#include "common/SXValueText.h"

namespace {

// One key of a section and the member it sets: a positive number, or a positive integer.
struct Field {
  const char* key;
  double* number = nullptr;
  uint64_t* integer = nullptr;
};

std::string Shown(const SXValue& value) {
  return value.dump(-1, ' ', false, SXValue::error_handler_t::replace);
}

bool ReadField(const Field& field, const SXValue& value, const std::string& path,
               std::string& error) {
  if (field.number) {
    if (value.is_number() && std::isfinite(value.get<double>()) && value.get<double>() > 0) {
      *field.number = value.get<double>();
      return true;
    }
    error = path + ": expected a positive number, got " + Shown(value);
    return false;
  }
  if (value.is_number_unsigned() && value.get<uint64_t>() > 0) {
    *field.integer = value.get<uint64_t>();
    return true;
  }
  error = path + ": expected a positive integer, got " + Shown(value);
  return false;
}

std::string KeyList(const std::vector<Field>& fields) {
  std::string list;
  for (const Field& field : fields) list += (list.empty() ? "" : ", ") + std::string(field.key);
  return list;
}

// Sets what `object` names among `fields`; `path` names the object in error texts.
bool ReadObject(const SXValue& object, const std::string& path, const std::vector<Field>& fields,
                std::string& error) {
  if (!object.is_object()) {
    error = path + ": expected an object, got " + Shown(object);
    return false;
  }
  for (const auto& [key, value] : object.items()) {
    const Field* field = nullptr;
    for (const Field& candidate : fields) {
      if (key == candidate.key) field = &candidate;
    }
    if (!field) {
      error = path + ": unknown key \"" + key + "\" (expected " + KeyList(fields) + ")";
      return false;
    }
    if (!ReadField(*field, value, path + "." + key, error)) return false;
  }
  return true;
}

std::vector<Field> StoreFields(SXStoreRetention& store) {
  return {{"maxAgeDays", &store.maxAgeDays}, {"maxBytes", nullptr, &store.maxBytes}};
}

std::string Days(double days) { return SXValueText(SXValue(days)) + " days"; }

std::string StoreText(const char* name, const SXStoreRetention& store) {
  return std::string(name) + " " + Days(store.maxAgeDays) + " or " +
         std::to_string(store.maxBytes) + " bytes";
}

}  // namespace

std::optional<SXRetentionPolicy> SXRetentionPolicy::fromJson(const SXValue& section,
                                                             std::string& error) {
  SXRetentionPolicy policy;
  if (section.is_null()) return policy;
  const std::vector<std::pair<std::string, std::vector<Field>>> sections = {
      {"analytics", StoreFields(policy.analytics)},
      {"powerLog", StoreFields(policy.powerLog)},
      {"spool", StoreFields(policy.spool)},
      {"summaryFiles",
       {{"maxAgeDays", &policy.summaryFiles.maxAgeDays},
        {"maxFiles", nullptr, &policy.summaryFiles.maxFiles}}},
      {"damagedCopies", {{"maxAgeDays", &policy.damagedCopies.maxAgeDays}}},
  };
  // The top level is read like a section whose fields are intervalSeconds and the sections
  // (which ReadObject never sees: they are taken out first), so errors name every key.
  std::vector<Field> top = {{"intervalSeconds", &policy.intervalSeconds}};
  for (const auto& [key, fields] : sections) top.push_back({key.c_str()});
  SXValue rest = section;
  for (const auto& [key, fields] : sections) {
    if (!rest.is_object() || !rest.contains(key)) continue;
    if (!ReadObject(rest[key], "retention." + key, fields, error)) return std::nullopt;
    rest.erase(key);
  }
  if (!ReadObject(rest, "retention", top, error)) return std::nullopt;
  return policy;
}

std::optional<SXRetentionPolicy> SXRetentionPolicy::fromConfigFile(const SXValue& file,
                                                                   std::string& error) {
  auto it = file.find("retention");
  if (it == file.end()) return SXRetentionPolicy();
  return fromJson(*it, error);
}

std::string SXRetentionPolicy::description() const {
  return StoreText("analytics", analytics) + ", " + StoreText("power log", powerLog) + ", " +
         StoreText("spool", spool) + " beside what its backends took; summary files " +
         Days(summaryFiles.maxAgeDays) + " and the newest " +
         std::to_string(summaryFiles.maxFiles) + ", damaged copies " +
         Days(damagedCopies.maxAgeDays) + "; every " + SXValueText(SXValue(intervalSeconds)) + " s";
}
