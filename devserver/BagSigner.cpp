#include "devserver/BagSigner.h"

#include "platform/linux/data/OpenSSLCryptography.h"
#include "platform/linux/data/PugixmlPropertyLists.h"
#include "platform/linux/data/RapidJSON.h"
#include "tools/StorebagFile.h"

namespace kyt::devserver {

std::variant<std::string, SigningError> BagSigner::sign(std::string_view bag, std::string_view format) const {
  PugixmlPropertyLists propertyLists;
  RapidJSON json;
  OpenSSLCryptography cryptography;
  const tools::StorebagFile file(propertyLists, json, cryptography);
  const auto read = file.read(bag, format);
  if (const auto* error = std::get_if<Error>(&read)) return SigningError{error->localizedDescription};
  auto document = file.sign(std::get<Dictionary>(read), key_);
  if (const auto* error = std::get_if<Error>(&document)) return SigningError{error->localizedDescription};
  return std::move(std::get<std::string>(document));
}

}  // namespace kyt::devserver
