// What the commands around storebags read and write them with. One thread.
#pragma once

#include "platform/linux/data/OpenSSLCryptography.h"
#include "platform/linux/data/PugixmlPropertyLists.h"
#include "platform/linux/data/RapidJSON.h"
#include "tools/StorebagFile.h"
#include "tools/kytctl/Commands.h"

namespace kyt::tools {

struct StorebagServices {
  PugixmlPropertyLists propertyLists;
  RapidJSON json;
  OpenSSLCryptography cryptography;
  StorebagFile file{propertyLists, json, cryptography};
};

// A bag that its author wrote, with the serial and the expiry that the options give it; warnings about it go to standard
// error.
[[nodiscard]] std::variant<Dictionary, Error> bagToSign(StorebagServices& services,
                                                        const SignOptions& options);

// Signed with the key that the options name.
[[nodiscard]] std::variant<std::string, Error> signedWith(StorebagServices& services,
                                                          const SignOptions& options, const Dictionary& bag);

}  // namespace kyt::tools
