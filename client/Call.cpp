#include "client/Call.h"

#include <span>

#include "platform/ipc/MessageWriter.h"
#include "platform/objects/Keys.h"

namespace kyt::client {

namespace {

// One for each kind of arguments, in the order of the method's signature.

void write(MessageWriter&, std::monostate, uint32_t) {}

void write(MessageWriter& out, const MessageArguments& given, uint32_t) {
  writeArguments(out, given);
}

void write(MessageWriter& out, const IdentityArguments& given, uint32_t) {
  out.writeDictionary(given.sessionInfo);
  out.writeOptionalDictionary(given.userInfo);
  out.writeOptionalValue(given.frameworks);
  out.writeBoolean(given.aggregates);
}

void write(MessageWriter& out, const SingleMessageArguments& given, uint32_t) {
  out.writeDictionary(given.sessionInfo);
  out.writeOptionalDictionary(given.userInfo);
  out.writeUInt16(given.category);
  out.writeUInt16(given.type);
  out.writeOptionalDictionary(given.payload);
}

void write(MessageWriter& out, const UserInfoArguments& given, uint32_t) {
  out.writeOptionalDictionary(given.userInfo);
}

void write(MessageWriter& out, const SharedDataArguments& given, uint32_t) {
  out.writeDictionary(given.entries);
}

void write(MessageWriter& out, const SharedDataForKeyArguments& given, uint32_t) {
  out.writeString(given.key);
  out.writeOptionalValue(given.value);
}

void write(MessageWriter& out, const DigestKeyArguments& given, uint32_t) {
  out.writeData(given.key.bytes());
  out.writeInt32(given.algorithm);
}

void write(MessageWriter& out, const UploadFileArguments& given, uint32_t descriptors) {
  out.writeString(given.fileURL);
  out.writeString("libkytreporting");  // any text will do
  out.writeDescriptorIndexes(descriptors);
}

void write(MessageWriter& out, const UploadLogDataArguments& given, uint32_t) {
  out.writeArray(given.logData);
}

}  // namespace

void writeArguments(MessageWriter& out, const MessageArguments& given) {
  // No dictionary, which would take a block from the allocator for each event.
  const DictionaryEntry entries[] = {
      {kKYTReportingMessageParametersCategory, static_cast<unsigned>(given.category)},
      {kKYTReportingMessageParametersType, static_cast<unsigned>(given.type)},
      {kKYTReportingMessageParametersPayload, given.payload},
      {kKYTReportingMessageParametersFlag, given.flag != 0 ? Value(given.flag) : Value()}};
  out.writeDictionary(std::span(entries));
}

void writeArguments(MessageWriter& out, const Arguments& arguments, uint32_t descriptors) {
  std::visit([&](const auto& given) { write(out, given, descriptors); }, arguments);
}

}  // namespace kyt::client
