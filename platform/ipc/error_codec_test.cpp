#include "platform/ipc/error_codec.h"

#include <capnp/message.h>
#include <gtest/gtest.h>

#include <string>

#include "platform/foundation/url.h"

namespace yomber::ipc {
namespace {

NSErrorRef throughTheWire(const NSErrorRef& error) {
  capnp::MallocMessageBuilder message;
  auto builder = message.initRoot<protocol::OptionalError>();
  encodeOptional(error, builder);
  return decodeOptional(builder.asReader());
}

TEST(ErrorCodec, NilStaysNil) { EXPECT_EQ(throughTheWire(nullptr), nullptr); }

TEST(ErrorCodec, EveryKindOfValueTravels) {
  const auto inner = NSError::errorWithDomain("inner", -3);
  const std::string bytes("no \xff UTF-8", 10);
  const auto error = NSError::errorWithDomain("domain", -1005,
                                              {{"text", bytes},
                                               {"integer", std::int64_t{-7}},
                                               {"real", 2.5},
                                               {"boolean", true},
                                               {NSUnderlyingErrorKey, inner},
                                               {"path", NSURL::fileURLWithPath("/a/b \xfe")}});
  const auto copy = throughTheWire(error);
  ASSERT_NE(copy, nullptr);
  EXPECT_TRUE(copy->is("domain", -1005));
  const auto& info = copy->userInfo();
  ASSERT_EQ(info.size(), 6U);
  EXPECT_EQ(std::get<std::string>(info.at("text")), bytes);
  EXPECT_EQ(std::get<std::int64_t>(info.at("integer")), -7);
  EXPECT_EQ(std::get<double>(info.at("real")), 2.5);
  EXPECT_EQ(std::get<bool>(info.at("boolean")), true);
  ASSERT_NE(copy->underlyingError(), nullptr);
  EXPECT_TRUE(copy->underlyingError()->is("inner", -3));
  EXPECT_EQ(std::get<NSURLRef>(info.at("path"))->path(), "/a/b \xfe");
}

TEST(ErrorCodec, NilValuesAreLeftOut) {
  const auto error = NSError::errorWithDomain(
      "d", 1, {{"error", NSErrorRef()}, {"url", NSURLRef()}, {"object", NSObjectRef()}});
  EXPECT_TRUE(throughTheWire(error)->userInfo().empty());
}

TEST(ErrorCodec, DeepErrorsAreCut) {
  NSErrorRef error = NSError::errorWithDomain("d", 0);
  for (std::int64_t code = 1; code < 40; ++code) {
    error = NSError::errorWithDomain("d", code, {{NSUnderlyingErrorKey, error}});
  }
  int depth = 0;
  for (auto at = throughTheWire(error)->underlyingError(); at; at = at->underlyingError()) ++depth;
  EXPECT_EQ(depth, kMaximumErrorDepth);
}

TEST(ErrorCodec, DeepErrorsOfAPeerAreCutToo) {
  capnp::MallocMessageBuilder message;
  auto root = message.initRoot<protocol::Error>();
  auto at = root;
  for (int i = 0; i < 20; ++i) {
    auto entry = at.initUserInfo(1)[0];
    entry.setKey(NSUnderlyingErrorKey);
    at = entry.getValue().initError();
  }
  int depth = 0;
  for (auto error = decodeError(root.asReader())->underlyingError(); error;
       error = error->underlyingError()) {
    ++depth;
  }
  EXPECT_EQ(depth, kMaximumErrorDepth);
}

struct Described final : NSObject {
  [[nodiscard]] std::string description() const override { return "a described object"; }
};
struct Named final : NSObject {
  explicit Named(std::string given) : name(std::move(given)) {}
  [[nodiscard]] std::string description() const override { return name; }
  std::string name;
};

TEST(ErrorCodec, ObjectsTravelByTheirCodecOrAsDescription) {
  const auto named = std::make_shared<const Named>("report.txt");
  const auto error = NSError::errorWithDomain(
      "d", 1,
      {{"item", NSObjectRef(named)}, {"other", NSObjectRef(std::make_shared<Described>())}});
  auto copy = throughTheWire(error);
  EXPECT_EQ(std::get<std::string>(copy->userInfo().at("item")), "report.txt");

  registerObjectCodec({
      .encode =
          [](const NSObjectRef& object, protocol::Item::Builder builder) {
            const auto* item = dynamic_cast<const Named*>(object.get());
            if (item == nullptr) return false;
            builder.setIdentifier(item->name.c_str());
            return true;
          },
      .decode = [](protocol::Item::Reader reader) -> NSObjectRef {
        return std::make_shared<const Named>(reader.getIdentifier().cStr());
      },
  });
  copy = throughTheWire(error);
  registerObjectCodec({});
  const auto item = std::get<NSObjectRef>(copy->userInfo().at("item"));
  ASSERT_NE(std::dynamic_pointer_cast<const Named>(item), nullptr);
  EXPECT_EQ(item->description(), "report.txt");
  EXPECT_EQ(std::get<std::string>(copy->userInfo().at("other")), "a described object");
}

TEST(ErrorCodec, TransportFailuresBecomeConnectionErrors) {
  const auto codeFor = [](kj::Exception::Type type) {
    return connectionError(kj::Exception(type, "f", 1, kj::heapString("why")))->code();
  };
  EXPECT_EQ(codeFor(kj::Exception::Type::DISCONNECTED), NSXPCConnectionInterrupted);
  EXPECT_EQ(codeFor(kj::Exception::Type::FAILED), NSXPCConnectionReplyInvalid);
  EXPECT_EQ(codeFor(kj::Exception::Type::UNIMPLEMENTED), NSXPCConnectionReplyInvalid);
  const auto error =
      connectionError(kj::Exception(kj::Exception::Type::FAILED, "f", 1, kj::heapString("why")));
  EXPECT_EQ(error->domain(), NSCocoaErrorDomain);
  EXPECT_EQ(error->localizedDescription(), "why");
}

}  // namespace
}  // namespace yomber::ipc
