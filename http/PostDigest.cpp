#include "http/PostDigest.h"

#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>

#include "platform/base/Hex.h"

namespace kyt::http {

std::string digestText(std::string_view key, std::string_view body) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned size = 0;
  HMAC(EVP_sha1(), key.data(), static_cast<int>(key.size()),
       reinterpret_cast<const unsigned char*>(body.data()), body.size(), digest, &size);
  std::string text = "<";
  for (unsigned i = 0; i < size; ++i) {
    if (i > 0 && i % 4 == 0) text += ' ';
    appendHexByte(digest[i], text);
  }
  return text + ">";
}

bool digestFits(std::string_view key, std::string_view body, std::string_view text) {
  const std::string expected = digestText(key, body);
  return expected.size() == text.size() && CRYPTO_memcmp(expected.data(), text.data(), text.size()) == 0;
}

}  // namespace kyt::http
