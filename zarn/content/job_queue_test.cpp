#include "zarn/content/job_queue.h"

#include <fcntl.h>

#include "zarn/content/test_content.h"

namespace yomber {
namespace {

constexpr std::uint64_t kMiB = 1 << 20;
constexpr JobQueue::Portion kSome{.jobs = 3, .bytes = kMiB};

std::vector<std::uint64_t> itemsOf(const std::vector<Job>& jobs) {
  std::vector<std::uint64_t> items;
  items.reserve(jobs.size());
  for (const Job& job : jobs) items.push_back(job.item);
  return items;
}

using Items = std::vector<std::uint64_t>;

class JobQueueTest : public TestDrive {
 protected:
  JobQueue queue{database, {.clock = [] { return std::int64_t{1}; }}};
};

TEST_F(JobQueueTest, HandsOutNoMoreThanIsDoneTogetherAndKeepsTheOrder) {
  for (const auto& [item, size] : {std::pair<std::uint64_t, std::uint64_t>{11, 1'000},
                                   {12, 2'000},
                                   {13, 5 * kMiB},
                                   {14, 1'000},
                                   {15, kMiB - 1'000},
                                   {16, 1},
                                   {17, 1},
                                   {18, 1},
                                   {19, 1}}) {
    queue.pushUrgent(item, size);
  }
  EXPECT_EQ(itemsOf(queue.take(JobKind::Download, kSome)), (Items{11, 12}));
  EXPECT_EQ(itemsOf(queue.take(JobKind::Download, kSome)), (Items{13}));
  EXPECT_EQ(itemsOf(queue.take(JobKind::Download, kSome)), (Items{14, 15}));
  EXPECT_EQ(itemsOf(queue.take(JobKind::Download, kSome)), (Items{16, 17, 18}));
  EXPECT_EQ(itemsOf(queue.take(JobKind::Download, kSome)), (Items{19}));
}

TEST_F(JobQueueTest, AnItemThatIsWorkedOnIsPassedOverUntilItIsReleased) {
  queue.pushUrgent(11, 1);
  const auto first = queue.take(JobKind::Download, kSome);
  queue.pushUrgent(11, 1);
  queue.pushUrgent(11, 1);
  queue.pushUrgent(12, 1);
  EXPECT_EQ(itemsOf(queue.take(JobKind::Download, kSome)), (Items{12}));
  queue.release(first);
  EXPECT_EQ(itemsOf(queue.take(JobKind::Download, kSome)), (Items{11}));
}

class ContentClaimsTest : public ContentDrive {};

TEST_F(ContentClaimsTest, ASmallWishBehindALargeOneIsAnsweredMeanwhile) {
  const std::string large = content(3'000'000);
  makeFault("large", large);
  makeFault("small", content(4'000, 2));
  engine->stop();
  options.downloadWorkers = 2;
  engine = ContentEngine::create(
      store, std::make_shared<Scanner>(store, std::weak_ptr<FolderVisitor>()), options);
  signIn("ann");
  Answer first;
  Answer second;
  // Both are there before anybody looks.
  const auto largeWish = engine->startProviding(at("large"), 0, first.take());
  const auto smallWish = engine->startProviding(at("small"), 0, second.take());
  stopAt("zarn.fill.begun");
  engine->start();
  ASSERT_TRUE(isStopped());
  EXPECT_EQ(second.get(), nullptr);
  EXPECT_FALSE(first.isThere());
  go();
  EXPECT_EQ(first.get(), nullptr);
  EXPECT_TRUE(read("large") == large);
}

TEST_F(ContentClaimsTest, ASmallDocumentBehindALargeOneIsUploadedMeanwhile) {
  engine->setStore(nullptr, {});
  {
    const FileDescriptor file(::open(at("large").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    ASSERT_EQ(ftruncate(file.get(), 200 << 20), 0);
  }
  scan();
  write("small", "text");
  scan();
  stopAt("zarn.upload.reading");
  signIn("ann");
  ASSERT_TRUE(isStopped());
  EXPECT_TRUE(waitUntil([&] { return state("small").upload == ContentState::Upload::Confirmed; }));
  EXPECT_EQ(state("large").upload, ContentState::Upload::Uploading);
  go();
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(state("large").upload, ContentState::Upload::Confirmed);
}

}  // namespace
}  // namespace yomber
