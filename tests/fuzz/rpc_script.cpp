#include "tests/fuzz/rpc_script.h"

#include <capnp/any.h>
#include <capnp/capability.h>
#include <capnp/dynamic.h>
#include <capnp/rpc.capnp.h>
#include <capnp/serialize-text.h>

#include "tests/fuzz/expect.h"
#include "tests/fuzz/hostile_input.h"

namespace yomber::fuzz {
namespace {

constexpr capnp::uint kFirstSegmentWords = 4096;

void setTarget(const RpcScript::Place& place, capnp::rpc::MessageTarget::Builder target) {
  auto answer = target.initPromisedAnswer();
  answer.setQuestionId(place.question);
  auto path = answer.initTransform(static_cast<capnp::uint>(place.pointers.size()));
  for (capnp::uint i = 0; i < path.size(); ++i) path[i].setGetPointerField(place.pointers[i]);
}

void setCapabilities(capnp::DynamicStruct::Builder parameters) {
  for (const auto field : parameters.getSchema().getFields()) {
    if (!field.getType().isInterface()) continue;
    const auto schema = field.getType().asInterface();
    capnp::Capability::Client own(KJ_EXCEPTION(UNIMPLEMENTED, "stands for itself"));
    parameters.set(field, own.castAs<capnp::DynamicCapability>(schema));
  }
}

}  // namespace

void RpcScript::add(capnp::MallocMessageBuilder& message) {
  const auto segments = message.getSegmentsForOutput();
  expect(segments.size() == 1, "a seed's message has one segment");
  const auto bytes = segments[0].asBytes();
  messages_.emplace_back(bytes.begin(), bytes.end());
}

RpcScript::Place RpcScript::bootstrap() {
  capnp::MallocMessageBuilder message(kFirstSegmentWords);
  message.initRoot<capnp::rpc::Message>().initBootstrap().setQuestionId(nextQuestion_);
  add(message);
  return {nextQuestion_++, {}};
}

RpcScript::Place RpcScript::call(const Place& target, capnp::InterfaceSchema interface,
                                 const char* method, const char* parameters) {
  const auto schema = interface.getMethodByName(method);
  capnp::MallocMessageBuilder message(kFirstSegmentWords);
  auto call = message.initRoot<capnp::rpc::Message>().initCall();
  call.setQuestionId(nextQuestion_);
  call.setInterfaceId(interface.getProto().getId());
  call.setMethodId(schema.getOrdinal());
  setTarget(target, call.initTarget());
  auto payload = call.initParams();
  capnp::BuilderCapabilityTable table;
  auto content =
      table.imbue(payload.getContent()).initAs<capnp::DynamicStruct>(schema.getParamType());
  capnp::TextCodec().decode(parameters, content);
  setCapabilities(content);
  auto descriptors = payload.initCapTable(static_cast<capnp::uint>(table.getTable().size()));
  for (capnp::uint i = 0; i < descriptors.size(); ++i)
    descriptors[i].setSenderHosted(nextExport_++);
  add(message);
  return {nextQuestion_++, {}};
}

void RpcScript::finish(const Place& place) {
  capnp::MallocMessageBuilder message(kFirstSegmentWords);
  auto finish = message.initRoot<capnp::rpc::Message>().initFinish();
  finish.setQuestionId(place.question);
  finish.setReleaseResultCaps(true);
  add(message);
}

std::vector<std::uint8_t> RpcScript::input(std::uint8_t mode) const {
  std::vector<std::uint8_t> bytes{mode};
  for (const auto& message : messages_) {
    if ((mode & kFramed) != 0) {
      appendChunk(bytes, message);
    } else {
      appendMessage(bytes, message);
    }
  }
  return bytes;
}

}  // namespace yomber::fuzz
