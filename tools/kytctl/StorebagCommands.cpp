// Keys and storebags.
#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "platform/linux/OpenSSLCryptography.h"
#include "platform/linux/PugixmlPropertyLists.h"
#include "platform/linux/RapidJSONWriter.h"
#include "tools/StorebagFile.h"
#include "tools/kytctl/Commands.h"

namespace kyt::tools {

namespace {

struct Services {
  PugixmlPropertyLists propertyLists;
  RapidJSONWriter json;
  OpenSSLCryptography cryptography;
  StorebagFile file{propertyLists, json, cryptography};
};

std::variant<Dictionary, Error> openDocument(Services& services, const std::string& path,
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
    std::fprintf(stderr, "warning: %s\n", warning.c_str());
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

int signCommand(const SignOptions& options) {
  Services services;
  auto text = readFile(options.bag);
  if (auto* error = std::get_if<Error>(&text)) return failed(*error);
  auto key = readFile(options.key);
  if (auto* error = std::get_if<Error>(&key)) return failed(*error);
  const size_t dot = options.bag.rfind('.');
  const std::string format = dot == std::string::npos ? "" : options.bag.substr(dot + 1);
  auto bag = services.file.read(std::get<std::string>(text), format);
  if (auto* error = std::get_if<Error>(&bag)) return failed(options.bag + ": " + error->localizedDescription);
  printWarnings(std::get<Dictionary>(bag));
  auto document = services.file.sign(std::get<Dictionary>(bag), std::get<std::string>(key));
  if (auto* error = std::get_if<Error>(&document)) return failed(*error);
  const std::string& bytes = std::get<std::string>(document);
  if (options.output == "-")
    return std::fwrite(bytes.data(), 1, bytes.size(), stdout) == bytes.size() ? 0 : 1;
  if (auto error = writeFile(options.output, bytes, 0644)) return failed(*error);
  return 0;
}

int verifyCommand(const std::string& document, const std::string& publicKey) {
  Services services;
  auto bag = openDocument(services, document, publicKey);
  if (auto* error = std::get_if<Error>(&bag)) return failed(document + ": " + error->localizedDescription);
  const Value* version = std::get<Dictionary>(bag).find("version");
  std::printf("%s: the signature holds; version %s\n", document.c_str(),
              version != nullptr ? description(*version).c_str() : "missing");
  return 0;
}

int showCommand(const std::string& document, const std::string& publicKey) {
  Services services;
  auto bag = openDocument(services, document, publicKey);
  if (auto* error = std::get_if<Error>(&bag)) return failed(document + ": " + error->localizedDescription);
  std::string text;
  services.json.writePretty(std::get<Dictionary>(bag), text);
  std::printf("%s\n", text.c_str());
  printWarnings(std::get<Dictionary>(bag));
  return 0;
}

}  // namespace kyt::tools
