// Storebag documents as a server sends them, signed with a key that is made anew in each test program.
#pragma once

#include <string>

#include "platform/PropertyLists.h"
#include "platform/objects/Value.h"

namespace kyt {

// The public key as clients' bundles hold it: a SubjectPublicKeyInfo in DER.
[[nodiscard]] Data testPublicKey();
// Another key's, with which nothing here is signed.
[[nodiscard]] Data otherPublicKey();

// {"signature": …, "bag": …} around these bytes, whatever they are.
[[nodiscard]] std::string signedDocument(std::string_view bagBytes, PropertyLists& propertyLists);
[[nodiscard]] std::string signedBag(const Dictionary& bag, PropertyLists& propertyLists);
// The same with a second signature, over SHA-256.
[[nodiscard]] std::string doublySignedBag(const Dictionary& bag, PropertyLists& propertyLists);

// A bag with one section for the environment "release".
[[nodiscard]] Dictionary releaseBag(const Dictionary& section, const char* version = "1.0");

}  // namespace kyt
