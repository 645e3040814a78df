// A folder enumerator takes 5,000 records from the daemon and hands them out.

#include "benchmarks/figure.h"
#include "platform/fileprovider/manager.h"
#include "provider/enumeration/file_enumerator.h"

namespace {

using namespace yomber;

constexpr std::size_t records = 5000;
constexpr std::size_t perBatch = 500;
constexpr int rounds = 20;

/// A host that takes every signal and does nothing.
class SilentHost final : public NSFileProviderManager::Transport {
 public:
  void signalEnumerator(const NSFileProviderItemIdentifier&,
                        std::function<void(NSErrorRef)> completionHandler) override {
    completionHandler(nullptr);
  }
};

class CountingObserver final : public NSFileProviderChangeObserver {
 public:
  void didUpdateItems(const NSFileProviderItems& items) override { count += items.size(); }
  void didDeleteItemsWithIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& identifiers) override {
    count += identifiers.size();
  }
  void finishEnumeratingChangesUpToSyncAnchor(NSFileProviderSyncAnchor newAnchor, bool) override {
    anchor = std::move(newAnchor);
  }
  void finishEnumeratingWithError(NSErrorRef) override {}

  std::size_t count = 0;
  NSFileProviderSyncAnchor anchor;
};

std::vector<QSQueryItems> batches() {
  std::vector<QSQueryItems> all;
  for (std::size_t number = 0; number < records; ++number) {
    if (number % perBatch == 0) all.emplace_back();
    ItemFields fields;
    fields.rawID = number + 1;
    fields.identifier = "d:" + std::to_string(fields.rawID);
    fields.filename = "report " + std::to_string(number) + ".pdf";
    all.back().push_back(std::make_shared<QSQueryItem>(std::move(fields)));
  }
  return all;
}

}  // namespace

int main() {
  NSFileProviderManager::defaultManager().setTransport(std::make_shared<SilentHost>());
  const auto enumerator = QSFileEnumerator::initWithFileObjectID(
      nullptr, NSURL::fileURLWithPath("/drive"), "i:1", Recursive::No);
  NSFileProviderSyncAnchor anchor;
  enumerator->currentSyncAnchorWithCompletionHandler(
      [&](NSFileProviderSyncAnchor first) { anchor = std::move(first); });

  const std::vector<QSQueryItems> all = batches();
  const auto observer = std::make_shared<CountingObserver>();
  const double seconds = bench::secondsFor([&] {
    for (int round = 0; round < rounds; ++round) {
      for (const QSQueryItems& batch : all) enumerator->receiveUpdates(batch, {}, {}, [] {});
      enumerator->enumerateChangesForObserver(observer, anchor);
      anchor = observer->anchor;
    }
  });
  bench::Figure figure;
  figure.name = "receiveUpdates of 5,000 records, then handing them out";
  figure.value = static_cast<double>(observer->count) / seconds;
  figure.unit = "records/s";
  figure.reached = observer->count == records * rounds;
  bench::print(figure);
  return figure.reached ? 0 : 1;
}
