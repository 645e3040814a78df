#include "platform/rozzel/asset_writer.h"

#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <utility>

#include "platform/rozzel/sparse_file.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {

StagedWriter::StagedWriter(StagedGroup& group, StagedFile file)
    : group_(group), file_(std::move(file)) {}

template <typename Work>
NSErrorRef StagedWriter::attempt(Work&& work) {
  if (!failure_) {
    failure_ = catchingFailures([&] {
      if (ended_) throwFailure(RZErrorInvalidArguments, "the asset was finished before");
      work();
    });
  }
  return failure_;
}

NSErrorRef StagedWriter::write(std::span<const std::byte> bytes) {
  return attempt([&] {
    while (!bytes.empty()) {
      const auto room = hasher_.buffer().subspan(buffered_);
      const std::size_t count = std::min(room.size(), bytes.size());
      std::memcpy(room.data(), bytes.data(), count);
      buffered_ += count;
      bytes = bytes.subspan(count);
      if (count == room.size()) flush();
    }
  });
}

NSErrorRef StagedWriter::writeZeros(std::uint64_t count) {
  return attempt([&] {
    flush();
    hasher_.submitZeros(count);
    offset_ += count;
  });
}

NSErrorRef StagedWriter::finish(RZAsset& asset) {
  return attempt([&] {
    flush();
    ended_ = true;
    const RZAsset written = hasher_.finish();
    if (ftruncate(file_.descriptor(), static_cast<off_t>(written.size)) != 0) {
      throwErrno("cannot set the size of an asset");
    }
    group_.add(std::move(file_), written);
    asset = written;
  });
}

void StagedWriter::flush() {
  if (buffered_ == 0) return;
  const auto bytes = hasher_.buffer().first(buffered_);
  hasher_.submit(buffered_);
  writeSparsely(file_.descriptor(), bytes, offset_);
  offset_ += buffered_;
  buffered_ = 0;
}

}  // namespace yomber
