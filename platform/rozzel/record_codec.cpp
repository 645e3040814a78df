#include "platform/rozzel/record_codec.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <utility>

#include "platform/rozzel/byte_stream.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {

namespace {

constexpr std::uint8_t kForm = 1;

// These numbers are in every store: they are never given another meaning.
enum class ValueKind : std::uint8_t {
  Text = 1,
  Bytes = 2,
  Integer = 3,
  Real = 4,
  Date = 5,
  Texts = 6,
  Reference = 7,
  Asset = 8,
};

/// Writes one value: its kind, then its bytes.
class ValueWriter {
 public:
  explicit ValueWriter(ByteSink& sink) : sink_(sink) {}

  void operator()(const std::string& text) {
    begin(ValueKind::Text);
    sink_.addText(text);
  }
  void operator()(const RZBytes& bytes) {
    begin(ValueKind::Bytes);
    sink_.addText(bytes.bytes);
  }
  void operator()(std::int64_t integer) {
    begin(ValueKind::Integer);
    sink_.addFixed(static_cast<std::uint64_t>(integer));
  }
  void operator()(double real) {
    begin(ValueKind::Real);
    sink_.addFixed(std::bit_cast<std::uint64_t>(real));
  }
  void operator()(NSDate date) {
    begin(ValueKind::Date);
    sink_.addFixed(static_cast<std::uint64_t>(date.nanoseconds()));
  }
  void operator()(const std::vector<std::string>& texts) {
    begin(ValueKind::Texts);
    sink_.addNumber(texts.size());
    for (const std::string& text : texts) sink_.addText(text);
  }
  void operator()(const RZReference& reference) {
    begin(ValueKind::Reference);
    sink_.addText(reference.recordID.recordName());
    sink_.addText(reference.recordID.zoneID().zoneName());
    sink_.addText(reference.recordID.zoneID().ownerName());
  }
  void operator()(const RZAsset& asset) {
    begin(ValueKind::Asset);
    for (const std::uint8_t byte : asset.hash) sink_.addByte(byte);
    sink_.addNumber(asset.size);
  }

 private:
  void begin(ValueKind kind) { sink_.addByte(static_cast<std::uint8_t>(kind)); }
  ByteSink& sink_;
};

[[noreturn]] void failDamaged() {
  throwFailure(RZErrorStoreDamaged,
               "a record in the store is damaged; restore the store's folder from a backup");
}

std::vector<std::string> readTexts(ByteSource& source) {
  std::vector<std::string> texts;
  for (std::uint64_t count = source.number(); count > 0 && source.good(); --count) {
    texts.emplace_back(source.text());
  }
  return texts;
}

RZReference readReference(ByteSource& source) {
  std::string recordName(source.text());
  std::string zoneName(source.text());
  std::string ownerName(source.text());
  return {
      RZRecordID(std::move(recordName), RZRecordZoneID(std::move(zoneName), std::move(ownerName)))};
}

RZAsset readAssetValue(ByteSource& source) {
  RZAsset asset;
  const std::string_view hash = source.raw(asset.hash.size());
  if (source.good()) std::memcpy(asset.hash.data(), hash.data(), hash.size());
  asset.size = source.number();
  return asset;
}

RZValue readValue(ByteSource& source) {
  switch (static_cast<ValueKind>(source.byte())) {
    case ValueKind::Text:
      return std::string(source.text());
    case ValueKind::Bytes:
      return RZBytes{std::string(source.text())};
    case ValueKind::Integer:
      return static_cast<std::int64_t>(source.fixed());
    case ValueKind::Real:
      return std::bit_cast<double>(source.fixed());
    case ValueKind::Date:
      return NSDate::fromNanoseconds(static_cast<std::int64_t>(source.fixed()));
    case ValueKind::Texts:
      return readTexts(source);
    case ValueKind::Reference:
      return readReference(source);
    case ValueKind::Asset:
      return readAssetValue(source);
  }
  failDamaged();
}

bool isDesired(std::string_view key, const RZDesiredKeys& desiredKeys) {
  return !desiredKeys ||
         std::find(desiredKeys->begin(), desiredKeys->end(), key) != desiredKeys->end();
}

}  // namespace

std::string encodeRecordValues(const RZValues& values) {
  ByteSink sink;
  sink.addByte(kForm);
  sink.addNumber(values.size());
  ValueWriter writer(sink);
  for (const auto& [key, value] : values) {
    sink.addText(key);
    std::visit(writer, value);
  }
  return sink.take();
}

RZValues decodeRecordValues(std::string_view bytes, const RZDesiredKeys& desiredKeys) {
  ByteSource source(bytes);
  if (source.byte() != kForm) failDamaged();
  RZValues values;
  for (std::uint64_t count = source.number(); count > 0 && source.good(); --count) {
    const std::string_view key = source.text();
    RZValue value = readValue(source);
    if (isDesired(key, desiredKeys)) values.emplace(key, std::move(value));
  }
  if (!source.finished()) failDamaged();
  return values;
}

}  // namespace yomber
