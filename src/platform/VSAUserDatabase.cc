#include "platform/VSAUserDatabase.h"

#include <grp.h>
#include <pwd.h>

#include <climits>
#include <cstdlib>
#include <string_view>
#include <vector>

#include "base/VSALog.h"
#include "base/VSAPlist.h"

VSAUserDatabase::VSAUserDatabase(VSASystemRoot root) : root_(std::move(root)) {}

namespace {
// A device's account files are a few lines; a larger one is not read.
constexpr size_t kVSAMaxAccountFileSize = 1 << 20;

std::vector<std::string> fields(std::string_view line) {
  std::vector<std::string> out;
  for (size_t start = 0;;) {
    size_t colon = line.find(':', start);
    out.emplace_back(line.substr(start, colon - start));
    if (colon == std::string_view::npos) break;
    start = colon + 1;
  }
  return out;
}

// The lines of one of the root's account files, split into fields; none when
// it cannot be read (a link, not a regular file, too large).
std::vector<std::vector<std::string>> records(const std::string& path) {
  std::vector<uint8_t> bytes;
  std::vector<std::vector<std::string>> out;
  if (VSAReadRegularFile(path, kVSAMaxAccountFileSize, &bytes) != 0) return out;
  std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
  while (!text.empty()) {
    size_t end = text.find('\n');
    std::string_view line = text.substr(0, end);
    if (!line.empty()) out.push_back(fields(line));
    text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
  }
  return out;
}

bool parseID(const std::string& text, unsigned long& out) {
  if (text.empty() || text.find_first_not_of("0123456789") != std::string::npos) return false;
  out = std::strtoul(text.c_str(), nullptr, 10);
  return true;
}
}  // namespace

std::optional<VSAUserAccount> VSAUserDatabase::find(const std::string* name,
                                                    const uid_t* uid) const {
  if (root_.isHostRoot()) {
    struct passwd pw, *result = nullptr;
    char buf[16384];
    int rc = name ? getpwnam_r(name->c_str(), &pw, buf, sizeof buf, &result)
                  : getpwuid_r(*uid, &pw, buf, sizeof buf, &result);
    if (rc != 0 || !result) return std::nullopt;
    return VSAUserAccount{pw.pw_name, pw.pw_uid, pw.pw_gid, pw.pw_dir ? pw.pw_dir : ""};
  }
  for (const auto& f : records(root_.resolve("/etc/passwd"))) {
    unsigned long u, g;
    if (f.size() < 7 || !parseID(f[2], u) || !parseID(f[3], g)) continue;
    if ((name && f[0] == *name) || (uid && u == *uid))
      return VSAUserAccount{f[0], static_cast<uid_t>(u), static_cast<gid_t>(g),
                            root_.resolve(f[5])};
  }
  return std::nullopt;
}

std::optional<VSAUserAccount> VSAUserDatabase::userNamed(const std::string& name) const {
  return find(&name, nullptr);
}

std::optional<VSAUserAccount> VSAUserDatabase::userWithUID(uid_t uid) const {
  return find(nullptr, &uid);
}

std::optional<gid_t> VSAUserDatabase::groupNamed(const std::string& name) const {
  if (root_.isHostRoot()) {
    struct group gr, *result = nullptr;
    char buf[16384];
    if (getgrnam_r(name.c_str(), &gr, buf, sizeof buf, &result) != 0 || !result)
      return std::nullopt;
    return gr.gr_gid;
  }
  for (const auto& f : records(root_.resolve("/etc/group"))) {
    unsigned long g;
    if (f.size() >= 3 && f[0] == name && parseID(f[2], g)) return static_cast<gid_t>(g);
  }
  return std::nullopt;
}

std::string VSAUserDatabase::homeDirectoryForUID(uid_t uid) const {
  auto account = userWithUID(uid);
  if (!account || account->homeDirectory.empty()) {
    VSALogIn(VSALogCategory::FS, kVSALogError, "homeDirectoryURLForPOSIXUID",
             "Failed to getpwuid for uid: %u", uid);
    VSALogIn(VSALogCategory::FS, kVSALogError, "homeDirectoryURLForPOSIXUID",
             "Failed to get home dir using getpwuid for uid: %u", uid);
    return root_.resolve("/private/var/mobile");
  }
  char buf[PATH_MAX];
  return realpath(account->homeDirectory.c_str(), buf) ? std::string(buf) : account->homeDirectory;
}
