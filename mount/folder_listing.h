#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <cstddef>
#include <vector>

#include "mount/fuse.h"

namespace yomber {

class Node;

/// A reply to a request for a folder's entries, which is being filled. One thread at a time.
class FolderListing {
 public:
  /// How entries are written: the kernel says with the request which it expects.
  enum class Form { Names, WithAttributes };

  /// `size`: how many bytes the kernel takes.
  FolderListing(fuse_req_t request, std::size_t size, Form form)
      : request_(request), form_(form), bytes_(size) {}

  [[nodiscard]] Form form() const { return form_; }

  /// By its name alone: the kernel looks it up when it needs it. Of `attributes`, the inode and the
  /// type are told. `next` is the position behind the entry. False when it does not fit.
  bool addName(const char* name, const struct stat& attributes, off_t next);
  /// An entry that the kernel is to remember, if the reply reaches it. In Form::WithAttributes, and
  /// when there is room for it.
  void addEntry(const char* name, const fuse_entry_param& entry, Node& node, off_t next);
  [[nodiscard]] bool hasRoomFor(const char* name) const;

  /// Whether something did not fit.
  [[nodiscard]] bool isFull() const { return isFull_; }
  [[nodiscard]] bool isEmpty() const { return used_ == 0; }
  /// The nodes that the kernel is told of.
  [[nodiscard]] const std::vector<Node*>& told() const { return told_; }

  /// Leaves the name alone of the last entry that was added. The node that the kernel is not told
  /// of therefore; nil when it was not before.
  Node* tellLastByName();
  /// What is told with attributes must be asked for again before it is used.
  void holdForNow();

  /// 0, or a negative errno.
  int answer() { return fuse_reply_buf(request_, bytes_.data(), used_); }

 private:
  char* rest() { return bytes_.data() + used_; }
  [[nodiscard]] std::size_t left() const { return bytes_.size() - used_; }
  bool took(std::size_t size);

  fuse_req_t request_;
  const Form form_;
  std::vector<char> bytes_;
  std::size_t used_ = 0;
  std::size_t last_ = 0;  ///< where the last entry begins
  bool isLastTold_ = false;
  bool isFull_ = false;
  std::vector<Node*> told_;
};

}  // namespace yomber
