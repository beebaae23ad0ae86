#include "platform/VSADirectoryStack.h"

#include <algorithm>

#include "base/VSAPathString.h"

VSADirectoryStack::VSADirectoryStack(VSAFileSystem& fs, int base, const std::string& topPath,
                                     size_t budget)
    : fs_(fs), base_(base), budget_(budget < 1 ? 1 : budget), path_(topPath) {}

void VSADirectoryStack::push(const std::string& name, VSAUniqueFd fd, const struct stat& st,
                             std::vector<VSADirectoryEntry> entries) {
  size_t parentPathLength = path_.size();
  if (!frames_.empty()) path_ = VSAPathJoin(path_, name);
  frames_.push_back({name, std::move(fd), st, std::move(entries), 0, parentPathLength});
  identities_.insert({st.st_dev, st.st_ino});
  if (frames_.size() == 1) {
    firstOpen_ = 1;
    return;
  }
  // Beyond the budget the shallowest descriptor (but the top's) goes.
  if (frames_.size() - firstOpen_ > budget_) frames_[firstOpen_++].fd.reset();
}

int VSADirectoryStack::enter(const std::string& name, const struct stat* expected, dev_t device,
                             Listing listing, int* listError) {
  int raw = -1;
  if (int rc = fs_.openDirectoryAt(current(), name, &raw)) return rc;
  VSAUniqueFd fd(raw);
  struct stat st;
  if (int rc = fs_.statAt(fd.get(), "", &st)) return rc;
  if (expected && !same(st, *expected)) return ESTALE;
  if (st.st_dev != device) return EXDEV;
  if (identities_.count({st.st_dev, st.st_ino})) return ELOOP;
  std::vector<VSADirectoryEntry> entries;
  if (listing != Listing::None) {
    if (int rc = fs_.readDirectoryAt(fd.get(), &entries)) {
      if (listing == Listing::Required) return rc;
      if (listError) *listError = rc;
      entries.clear();
    }
    // Visited in inode order, not the directory's hash order: removals and
    // status calls then walk the inode table (and the journal's blocks) in
    // order instead of at random.
    std::sort(
        entries.begin(), entries.end(),
        [](const VSADirectoryEntry& a, const VSADirectoryEntry& b) { return a.inode < b.inode; });
  }
  push(name, std::move(fd), st, std::move(entries));
  return 0;
}

const VSADirectoryEntry* VSADirectoryStack::nextEntry() {
  Frame& f = frames_.back();
  if (f.next >= f.entries.size()) return nullptr;
  return &f.entries[f.next++];
}

int VSADirectoryStack::parentFd() const {
  return frames_.size() <= 1 ? base_ : frames_[frames_.size() - 2].fd.get();
}

int VSADirectoryStack::reopenParent() {
  if (frames_.size() <= 2) return 0;  // the base, or the top
  size_t index = frames_.size() - 2;
  if (index >= firstOpen_) return 0;
  int rc = reopenThroughDotDot(frames_[index], fd());
  if (rc != 0) rc = reopenFromBottom(index);
  if (rc != 0) return rc;
  firstOpen_ = index;
  return 0;
}

void VSADirectoryStack::pop() {
  Frame& f = frames_.back();
  identities_.erase({f.st.st_dev, f.st.st_ino});
  if (frames_.size() > 1) path_.resize(f.parentPathLength);
  frames_.pop_back();
}

int VSADirectoryStack::reopenThroughDotDot(Frame& parent, int child) {
  int raw = -1;
  if (int rc = fs_.openDirectoryAt(child, "..", &raw)) return rc;
  VSAUniqueFd fd(raw);
  struct stat st;
  if (int rc = fs_.statAt(fd.get(), "", &st)) return rc;
  if (!same(st, parent.st)) return ESTALE;
  parent.fd = std::move(fd);
  return 0;
}

// Of the directories above `index` only the top is open (the ones between
// lost their descriptors before it did): walk down again by name from the
// top, checking each step.
int VSADirectoryStack::reopenFromBottom(size_t index) {
  VSAUniqueFd held;
  int current = frames_[0].fd.get();
  for (size_t k = 1; k <= index; ++k) {
    int raw = -1;
    if (int rc = fs_.openDirectoryAt(current, frames_[k].name, &raw)) return rc;
    VSAUniqueFd fd(raw);
    struct stat st;
    if (int rc = fs_.statAt(fd.get(), "", &st)) return rc;
    if (!same(st, frames_[k].st)) return ESTALE;
    held = std::move(fd);
    current = held.get();
  }
  frames_[index].fd = std::move(held);
  return 0;
}
