#include "sqlite/RetentionPolicy.h"

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

SXStatus ReadField(const Field& field, const SXValue& value, const std::string& path) {
  if (field.number) {
    if (value.is_number() && std::isfinite(value.get<double>()) && value.get<double>() > 0) {
      *field.number = value.get<double>();
      return {};
    }
    return SXFailure(path + ": expected a positive number, got " + Shown(value));
  }
  if (value.is_number_unsigned() && value.get<uint64_t>() > 0) {
    *field.integer = value.get<uint64_t>();
    return {};
  }
  return SXFailure(path + ": expected a positive integer, got " + Shown(value));
}

std::string KeyList(const std::vector<Field>& fields) {
  std::string list;
  for (const Field& field : fields) list += (list.empty() ? "" : ", ") + std::string(field.key);
  return list;
}

// Sets what `object` names among `fields`; `path` names the object in error texts.
SXStatus ReadObject(const SXValue& object, const std::string& path,
                    const std::vector<Field>& fields) {
  if (!object.is_object()) return SXFailure(path + ": expected an object, got " + Shown(object));
  for (const auto& [key, value] : object.items()) {
    const Field* field = nullptr;
    for (const Field& candidate : fields) {
      if (key == candidate.key) field = &candidate;
    }
    if (!field) {
      return SXFailure(path + ": unknown key \"" + key + "\" (expected " + KeyList(fields) + ")");
    }
    if (SXStatus read = ReadField(*field, value, path + "." + key); !read.ok()) return read;
  }
  return {};
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

SXResult<SXRetentionPolicy> SXRetentionPolicy::fromJson(const SXValue& section) {
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
    if (SXStatus read = ReadObject(rest[key], "retention." + key, fields); !read.ok()) {
      return read;
    }
    rest.erase(key);
  }
  if (SXStatus read = ReadObject(rest, "retention", top); !read.ok()) return read;
  return policy;
}

SXResult<SXRetentionPolicy> SXRetentionPolicy::fromConfigFile(const SXValue& file) {
  auto it = file.find("retention");
  if (it == file.end()) return SXRetentionPolicy();
  return fromJson(*it);
}

std::string SXRetentionPolicy::description() const {
  return StoreText("analytics", analytics) + ", " + StoreText("power log", powerLog) + ", " +
         StoreText("spool", spool) + " beside what its backends took; summary files " +
         Days(summaryFiles.maxAgeDays) + " and the newest " +
         std::to_string(summaryFiles.maxFiles) + ", damaged copies " +
         Days(damagedCopies.maxAgeDays) + "; every " + SXValueText(SXValue(intervalSeconds)) + " s";
}
