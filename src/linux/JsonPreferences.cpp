#include "linux/JsonPreferences.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <string_view>

#include "common/SXValueText.h"
#include "linux/PosixFileSystem.h"

namespace {

constexpr unsigned kDirectoryMode = 0755;

struct FileRead {
  std::optional<std::string> contents;  // nothing when the file could not be read
  int error = 0;                        // errno of the failure; ENOENT when absent
};

FileRead ReadWholeFile(const std::string& path) {
  SXScopedFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (fd.get() < 0) return {std::nullopt, errno};
  std::string contents;
  char buffer[8192];
  for (;;) {
    ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return {std::nullopt, errno};
    if (n == 0) return {std::move(contents), 0};
    contents.append(buffer, static_cast<size_t>(n));
  }
}

// Blocks until this open file description holds the exclusive lock.
int LockExclusive(int fd) {
  while (::flock(fd, LOCK_EX) != 0) {
    if (errno != EINTR) return errno;
  }
  return 0;
}

// The object as written to disk; nothing when it cannot be serialised (invalid UTF-8).
std::optional<std::string> Serialize(const SXValue& object) {
  try {
    return object.dump(2, ' ', false, SXValue::error_handler_t::strict) + "\n";
  } catch (const SXValue::exception&) {
    return std::nullopt;
  }
}

bool EqualsIgnoringCase(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) return false;
  for (size_t i = 0; i < a.size(); ++i) {
    if (std::tolower(static_cast<unsigned char>(a[i])) !=
        std::tolower(static_cast<unsigned char>(b[i]))) {
      return false;
    }
  }
  return true;
}

}  // namespace

SXJsonPreferences::SXJsonPreferences(std::string directory, std::shared_ptr<SXLogFacility> log)
    : directory_(std::move(directory)), log_(std::move(log)) {}

bool SXJsonPreferences::isValidDomain(const std::string& domain) {
  return !domain.empty() && domain != "." && domain != ".." &&
         domain.find('/') == std::string::npos && domain.find('\0') == std::string::npos;
}

std::string SXJsonPreferences::domainPath(const std::string& domain) const {
  return directory_ + "/" + domain + ".json";
}

SXValue SXJsonPreferences::readDomain(const std::string& path, std::string* unusable) {
  FileRead file = ReadWholeFile(path);
  if (!file.contents) {
    if (file.error != ENOENT) {
      std::string error = SXErrnoText(path, file.error);
      SXLOG(*log_, nullptr, SXLogLevel::kError, "cannot read preferences: %s", error);
      if (unusable) *unusable = "cannot read preferences: " + error;
    }
    return SXValue::object();
  }
  SXValue parsed = SXValue::parse(*file.contents, nullptr, false);
  if (!parsed.is_object()) {
    SXLOG(*log_, nullptr, SXLogLevel::kError, "preferences file %s is not a JSON object", path);
    if (unusable)
      *unusable = "preferences file " + path + " is not a JSON object; not replacing it";
    return SXValue::object();
  }
  return parsed;
}

std::optional<SXValue> SXJsonPreferences::copyValue(const std::string& domain,
                                                    const std::string& key) {
  if (!isValidDomain(domain)) return std::nullopt;
  SXValue object = readDomain(domainPath(domain));
  auto it = object.find(key);
  if (it == object.end()) return std::nullopt;
  return *it;
}

SXValue SXJsonPreferences::copyDomain(const std::string& domain) {
  if (!isValidDomain(domain)) return SXValue::object();
  return readDomain(domainPath(domain));
}

SXStatus SXJsonPreferences::setValue(const std::string& domain, const std::string& key,
                                     const std::optional<SXValue>& value) {
  if (!isValidDomain(domain)) {
    return SXFailure("preferences domain \"" + domain + "\" is not a valid name");
  }
  if (value && value->is_discarded()) {
    return SXFailure("preferences value for \"" + key + "\" is invalid");
  }
  SXPosixFileSystem fileSystem;
  if (SXStatus made = fileSystem.createDirectory(directory_, kDirectoryMode); !made.ok()) {
    return made;
  }

  // The lock spans read-modify-write so a concurrent writer's keys are read before we replace
  // the file; the lock file itself is never replaced, unlike the domain file.
  std::string path = domainPath(domain);
  std::string lockPath = path + ".lock";
  SXScopedFd lock(::open(lockPath.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0644));
  if (lock.get() < 0) return SXErrnoStatus(lockPath, errno);
  if (int err = LockExclusive(lock.get())) return SXErrnoStatus(lockPath, err);

  // A file we cannot read or parse may still be someone's: replacing it would lose it.
  std::string unusable;
  SXValue object = readDomain(path, &unusable);
  if (!unusable.empty()) return SXFailure(unusable);
  if (value) {
    object[key] = *value;
  } else if (object.erase(key) == 0) {
    return {};  // nothing to remove: leave the file as it is
  }
  std::optional<std::string> text = Serialize(object);
  if (!text) return SXFailure("preferences value for \"" + key + "\" is not valid UTF-8");
  if (SXStatus written = fileSystem.writeFileAtomically(path, *text); !written.ok()) {
    return written;
  }
  return {};
}

// A boolean is deliberately not a string: a switch stored where a name belongs is a mistake,
// and printing it as "1" would hide that.
std::optional<std::string> SXPreferencesValueAsString(const SXValue& value) {
  if (value.is_string()) return value.get<std::string>();
  if (value.is_number()) return SXValueText(value);
  return std::nullopt;
}

bool SXPreferencesValueAsBool(const SXValue& value) {
  if (value.is_boolean()) return value.get<bool>();
  // Every non-zero integer stays non-zero as a double, so one test covers all number kinds.
  if (value.is_number()) return value.get<double>() != 0.0;
  if (!value.is_string()) return false;
  const std::string& text = value.get_ref<const std::string&>();
  for (std::string_view yes : {"YES", "true", "1"}) {
    if (EqualsIgnoringCase(text, yes)) return true;
  }
  return false;
}
