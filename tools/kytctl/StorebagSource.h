// Where a rehearsal's storebag comes from: the server that the device asks, or a file. One thread at a time.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <variant>

#include "platform/base/Error.h"
#include "tools/explain/Rehearsal.h"
#include "tools/kytctl/DevicePorts.h"

namespace kyt {
class CurlURLSessionFactory;
class URLSession;
}  // namespace kyt

namespace kyt::tools {

class StorebagSource {
 public:
  // A document as servers hand it out, or a bag that nobody has signed yet (.json, .toml or .plist).
  [[nodiscard]] static std::variant<std::unique_ptr<StorebagSource>, Error> file(const std::string& path,
                                                                                 DevicePorts& ports);
  // What the running daemon has in force for that name and will not fetch anew for the next session. Null: there is none, no
  // daemon runs beneath the root, or whoever asks may not look at it.
  [[nodiscard]] static std::unique_ptr<StorebagSource> daemon(const std::string& root,
                                                              const std::string& name, DevicePorts& ports);
  // The device's, with its authorities; asked once.
  [[nodiscard]] static std::unique_ptr<StorebagSource> server(DevicePorts& ports);
  ~StorebagSource();

  // It refers to this object.
  [[nodiscard]] Rehearsal::StorebagServer answers();
  // A file, or the address once it was asked.
  [[nodiscard]] const std::string& from() const { return from_; }
  // Whether the rehearsal checks the signature.
  [[nodiscard]] bool isSigned() const { return signature_ == kRequired; }
  // "required", "not checked", "checked by the daemon".
  [[nodiscard]] const std::string& signature() const { return signature_; }
  // Why the server gave no answer at all; empty as long as it did.
  [[nodiscard]] const std::string& problem() const { return problem_; }

 private:
  StorebagSource();
  [[nodiscard]] FakeURLSessionFactory::Reply fetch(const URLRequest& request);

  struct Network;
  std::unique_ptr<Network> network_;  // none: a file
  std::optional<FakeURLSessionFactory::Reply> reply_;
  std::string from_, problem_;
  static constexpr char kRequired[] = "required";
  std::string signature_ = kRequired;
};

}  // namespace kyt::tools
