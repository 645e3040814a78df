#include "platform/ipc/error_codec.h"

#include <algorithm>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>

#include "platform/foundation/lock.h"
#include "platform/foundation/url.h"

namespace yomber::ipc {

namespace {

using protocol::Error;

class CodecRegistry {
 public:
  static CodecRegistry& shared() {
    static CodecRegistry* const registry = new CodecRegistry();
    return *registry;
  }
  void set(ObjectCodec codec) {
    auto next = std::make_shared<const ObjectCodec>(std::move(codec));
    LockGuard guard(mutex_);
    codec_.swap(next);
  }
  [[nodiscard]] std::shared_ptr<const ObjectCodec> get() const {
    LockGuard guard(mutex_);
    return codec_;
  }

 private:
  mutable Mutex mutex_;
  std::shared_ptr<const ObjectCodec> codec_ GUARDED_BY(mutex_) =
      std::make_shared<const ObjectCodec>();
};

capnp::Data::Reader dataOf(std::string_view bytes) {
  return {reinterpret_cast<const kj::byte*>(bytes.data()), bytes.size()};
}

capnp::Text::Reader textOf(const std::string& text) { return {text.c_str(), text.size()}; }

std::string stringOf(capnp::Data::Reader data) {
  return {reinterpret_cast<const char*>(data.begin()), data.size()};
}

std::string stringOf(capnp::Text::Reader text) { return {text.cStr(), text.size()}; }

void encode(const NSErrorRef& error, Error::Builder builder, int depth);

/// Whether a value travels at all: nil does not, nor an error that lies too deep.
bool travels(const NSErrorValue& value, int depth) {
  if (const auto* error = std::get_if<NSErrorRef>(&value)) {
    return *error != nullptr && depth < kMaximumErrorDepth;
  }
  if (const auto* url = std::get_if<NSURLRef>(&value)) return *url != nullptr;
  if (const auto* object = std::get_if<NSObjectRef>(&value)) return *object != nullptr;
  return true;
}

void encodeObject(const NSObjectRef& object, Error::Entry::Value::Builder value) {
  const auto codec = CodecRegistry::shared().get();
  if (codec->encode && codec->encode(object, value.initItem())) return;
  value.setDescription(textOf(object->description()));
}

struct ValueEncoder {
  Error::Entry::Value::Builder out;
  int depth;

  void operator()(const std::string& text) { out.setText(dataOf(text)); }
  void operator()(std::int64_t integer) { out.setInteger(integer); }
  void operator()(double real) { out.setReal(real); }
  void operator()(bool boolean) { out.setBoolean(boolean); }
  void operator()(const NSErrorRef& error) { encode(error, out.initError(), depth + 1); }
  void operator()(const NSURLRef& url) { out.setPath(dataOf(url->path())); }
  void operator()(const NSObjectRef& object) { encodeObject(object, out); }
};

void encode(const NSErrorRef& error, Error::Builder builder, int depth) {
  builder.setDomain(textOf(error->domain()));
  builder.setCode(error->code());
  const auto& info = error->userInfo();
  const auto count = std::ranges::count_if(
      info, [depth](const auto& entry) { return travels(entry.second, depth); });
  auto entries = builder.initUserInfo(static_cast<kj::uint>(count));
  kj::uint index = 0;
  for (const auto& [key, value] : info) {
    if (!travels(value, depth)) continue;
    auto entry = entries[index++];
    entry.setKey(textOf(key));
    std::visit(ValueEncoder{entry.getValue(), depth}, value);
  }
}

NSErrorRef decode(Error::Reader reader, int depth);

std::optional<NSErrorValue> decodeItem(protocol::Item::Reader item) {
  const auto codec = CodecRegistry::shared().get();
  NSObjectRef object = codec->decode ? codec->decode(item) : nullptr;
  if (!object) return std::nullopt;
  return object;
}

std::optional<NSErrorValue> decodeValue(Error::Entry::Value::Reader value, int depth) {
  using Value = Error::Entry::Value;
  switch (value.which()) {
    case Value::TEXT:
      return stringOf(value.getText());
    case Value::INTEGER:
      return std::int64_t{value.getInteger()};
    case Value::REAL:
      return value.getReal();
    case Value::BOOLEAN:
      return value.getBoolean();
    case Value::ERROR:
      if (depth >= kMaximumErrorDepth) return std::nullopt;
      return decode(value.getError(), depth + 1);
    case Value::PATH:
      if (NSURLRef url = NSURL::fileURLWithPath(stringOf(value.getPath()))) return url;
      return std::nullopt;
    case Value::ITEM:
      return decodeItem(value.getItem());
    case Value::DESCRIPTION:
      return stringOf(value.getDescription());
  }
  return std::nullopt;
}

NSErrorRef decode(Error::Reader reader, int depth) {
  NSErrorUserInfo info;
  for (const Error::Entry::Reader entry : reader.getUserInfo()) {
    if (auto value = decodeValue(entry.getValue(), depth)) {
      info.insert_or_assign(stringOf(entry.getKey()), std::move(*value));
    }
  }
  return NSError::errorWithDomain(stringOf(reader.getDomain()), reader.getCode(), std::move(info));
}

std::int64_t codeOf(kj::Exception::Type type) {
  return type == kj::Exception::Type::DISCONNECTED ? NSXPCConnectionInterrupted
                                                   : NSXPCConnectionReplyInvalid;
}

}  // namespace

void encodeError(const NSErrorRef& error, Error::Builder builder) { encode(error, builder, 0); }

NSErrorRef decodeError(Error::Reader reader) { return decode(reader, 0); }

void encodeOptional(const NSErrorRef& error, protocol::OptionalError::Builder builder) {
  if (error) {
    encodeError(error, builder.initError());
  } else {
    builder.setNone();
  }
}

NSErrorRef decodeOptional(protocol::OptionalError::Reader reader) {
  return reader.isError() ? decodeError(reader.getError()) : nullptr;
}

void registerObjectCodec(ObjectCodec codec) { CodecRegistry::shared().set(std::move(codec)); }

NSErrorRef connectionError(const kj::Exception& exception) {
  const kj::StringPtr text = exception.getDescription();
  return connectionError(codeOf(exception.getType()), std::string(text.cStr(), text.size()));
}

NSErrorRef connectionError(std::int64_t code, std::string text) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, code,
                                  {{NSLocalizedDescriptionKey, std::move(text)}});
}

}  // namespace yomber::ipc
