// Keys and storebags.
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>

#include "config/StorebagGuard.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/base/LinuxClock.h"
#include "tools/StorebagFile.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/JSONText.h"
#include "tools/kytctl/StorebagServices.h"

namespace kyt::tools {

namespace {

std::variant<Dictionary, Error> openDocument(StorebagServices& services, const std::string& path,
                                             const std::string& publicKeyPath) {
  auto document = readFile(path);
  if (auto* error = std::get_if<Error>(&document)) return std::move(*error);
  std::optional<std::string_view> key;
  std::variant<std::string, Error> keyFile;
  if (!publicKeyPath.empty()) {
    keyFile = readFile(publicKeyPath);
    if (auto* error = std::get_if<Error>(&keyFile)) return std::move(*error);
    key = std::get<std::string>(keyFile);
  }
  return services.file.open(std::get<std::string>(document), key);
}

void printWarnings(const Dictionary& bag) {
  for (const std::string& warning : StorebagFile::warnings(bag))
    std::fprintf(stderr, "warning: %s\n", escapedText(warning).c_str());
}

}  // namespace

int makeKeysCommand(const std::string& folder, unsigned bits) {
  auto made = makeKeyPair(bits);
  if (auto* error = std::get_if<Error>(&made)) return failed(*error);
  if (mkdir(folder.c_str(), 0700) != 0 && errno != EEXIST)
    return failed(folder + ": " + std::strerror(errno));
  const auto& keys = std::get<KeyPair>(made);
  if (auto error = writeFile(folder + "/private.pem", keys.privateKeyPEM, 0600)) return failed(*error);
  if (auto error = writeFile(folder + "/publicKey.der", keys.publicKeyDER, 0644)) return failed(*error);
  std::printf("%s/private.pem\n%s/publicKey.der\n", folder.c_str(), folder.c_str());
  return 0;
}

std::variant<Dictionary, Error> bagToSign(StorebagServices& services, const SignOptions& options) {
  auto text = readFile(options.bag);
  if (auto* error = std::get_if<Error>(&text)) return std::move(*error);
  const size_t dot = options.bag.rfind('.');
  auto read = services.file.read(std::get<std::string>(text),
                                 dot == std::string::npos ? "" : options.bag.substr(dot + 1));
  if (auto* error = std::get_if<Error>(&read)) {
    error->localizedDescription = options.bag + ": " + error->localizedDescription;
    return std::move(*error);
  }
  Dictionary& bag = std::get<Dictionary>(read);
  if (options.serial) bag.set(kStorebagSerial, int64_t{*options.serial});
  if (options.expiresInDays)
    bag.set(kStorebagExpires, LinuxClock().timeOfDay().seconds + int64_t{*options.expiresInDays} * 86400);
  printWarnings(bag);
  return read;
}

std::variant<std::string, Error> signedWith(StorebagServices& services, const SignOptions& options,
                                            const Dictionary& bag) {
  auto key = readFile(options.key);
  if (auto* error = std::get_if<Error>(&key)) return std::move(*error);
  return services.file.sign(bag, std::get<std::string>(key));
}

int signCommand(const SignOptions& options) {
  StorebagServices services;
  auto bag = bagToSign(services, options);
  if (auto* error = std::get_if<Error>(&bag)) return failed(*error);
  auto document = signedWith(services, options, std::get<Dictionary>(bag));
  if (auto* error = std::get_if<Error>(&document)) return failed(*error);
  const std::string& bytes = std::get<std::string>(document);
  if (options.output == "-")
    return std::fwrite(bytes.data(), 1, bytes.size(), stdout) == bytes.size() ? 0 : 1;
  if (auto error = writeFile(options.output, bytes, 0644)) return failed(*error);
  return 0;
}

int verifyCommand(const std::string& document, const std::string& publicKey) {
  StorebagServices services;
  auto bag = openDocument(services, document, publicKey);
  if (auto* error = std::get_if<Error>(&bag)) return failed(document + ": " + error->localizedDescription);
  const Value* version = std::get<Dictionary>(bag).find("version");
  std::printf("%s: the signature holds; version %s\n", document.c_str(),
              version != nullptr ? escapedText(description(*version)).c_str() : "missing");
  return 0;
}

int showCommand(const std::string& document, const std::string& publicKey) {
  StorebagServices services;
  auto bag = openDocument(services, document, publicKey);
  if (auto* error = std::get_if<Error>(&bag)) return failed(document + ": " + error->localizedDescription);
  std::printf("%s\n", prettyJSON(std::get<Dictionary>(bag)).c_str());
  printWarnings(std::get<Dictionary>(bag));
  return 0;
}

}  // namespace kyt::tools
