#include "mount/folder_listing.h"

#include <linux/fuse.h>

#include <cstring>

namespace yomber {

bool FolderListing::took(std::size_t size) {
  isFull_ = size > left();
  if (isFull_) return false;
  last_ = used_;
  used_ += size;
  isLastTold_ = false;
  return true;
}

bool FolderListing::addName(const char* name, const struct stat& attributes, off_t next) {
  if (form_ == Form::Names) {
    return took(fuse_add_direntry(request_, rest(), left(), name, &attributes, next));
  }
  fuse_entry_param entry{};  // without a node
  entry.attr.st_ino = attributes.st_ino;
  entry.attr.st_mode = attributes.st_mode;
  return took(fuse_add_direntry_plus(request_, rest(), left(), name, &entry, next));
}

void FolderListing::addEntry(const char* name, const fuse_entry_param& entry, Node& node,
                             off_t next) {
  isLastTold_ = took(fuse_add_direntry_plus(request_, rest(), left(), name, &entry, next));
  if (isLastTold_) told_.push_back(&node);
}

bool FolderListing::hasRoomFor(const char* name) const {
  return fuse_add_direntry_plus(request_, nullptr, 0, name, nullptr, 0) <= left();
}

Node* FolderListing::tellLastByName() {
  if (!isLastTold_) return nullptr;
  isLastTold_ = false;
  std::memset(bytes_.data() + last_, 0, sizeof(fuse_entry_out));
  Node* const node = told_.back();
  told_.pop_back();
  return node;
}

void FolderListing::holdForNow() {
  for (std::size_t at = 0; at + sizeof(fuse_direntplus) <= used_;) {
    fuse_direntplus entry{};
    std::memcpy(&entry, bytes_.data() + at, sizeof entry);
    entry.entry_out.entry_valid = 0;
    entry.entry_out.entry_valid_nsec = 0;
    entry.entry_out.attr_valid = 0;
    entry.entry_out.attr_valid_nsec = 0;
    std::memcpy(bytes_.data() + at, &entry, sizeof entry);
    at += FUSE_DIRENTPLUS_SIZE(&entry);
  }
}

}  // namespace yomber
