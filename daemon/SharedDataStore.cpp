#include "daemon/SharedDataStore.h"

namespace kyt {

namespace {

// What an entry costs besides its texts: its cells, its charge, the tree's node.
constexpr uint64_t kEntryBytes = 160;

uint64_t valueBytes(const Value& value) {
  uint64_t bytes = sizeof(Value);
  if (const String* text = value.string()) return bytes + text->size();
  if (const Data* data = value.data()) return bytes + data->size();
  if (const Array* array = value.array())
    for (const Value& element : *array) bytes += valueBytes(element);
  if (const Dictionary* dictionary = value.dictionary())
    for (const DictionaryEntry& entry : *dictionary)
      bytes += sizeof(String) + entry.key.size() + valueBytes(entry.value);
  return bytes;
}

uint64_t entryBytes(const String& key, const Value& value) {
  return kEntryBytes + 2 * key.size() + valueBytes(value);
}

}  // namespace

bool SharedDataStore::update(const String& token, const Dictionary& sharedData, uint32_t user) {
  const auto existing = byToken_.find(token.view());
  uint64_t added = existing == byToken_.end() ? kEntryBytes + token.size() : 0, credited = 0;
  for (const DictionaryEntry& entry : sharedData) {
    added += entryBytes(entry.key, entry.value);
    if (existing == byToken_.end()) continue;
    const auto charge = existing->second.charges.find(entry.key.view());
    if (charge != existing->second.charges.end() && charge->second.user == user)
      credited += charge->second.bytes;
  }
  const std::shared_ptr<UserAccount> account = budget_.account(user);
  if (!take(*account, added, credited)) return false;

  Shared& shared = byToken_[token.str()];
  if (shared.token.bytes == 0) {
    shared.token = Charge{user, kEntryBytes + token.size()};
  }
  for (const DictionaryEntry& entry : sharedData) {
    shared.values.set(entry.key, entry.value);
    Charge& charge = shared.charges[entry.key.str()];
    credit(charge);
    charge = Charge{user, entryBytes(entry.key, entry.value)};
  }
  return true;
}

void SharedDataStore::removeObject(const String& token, const String& key) {
  const auto shared = byToken_.find(token.view());
  if (shared == byToken_.end()) return;
  shared->second.values.remove(key);
  const auto charge = shared->second.charges.find(key.view());
  if (charge == shared->second.charges.end()) return;
  credit(charge->second);
  shared->second.charges.erase(charge);
}

void SharedDataStore::removeToken(const String& token) {
  const auto shared = byToken_.find(token.view());
  if (shared == byToken_.end()) return;
  credit(shared->second.token);
  for (const auto& [key, charge] : shared->second.charges) credit(charge);
  byToken_.erase(shared);
}

std::optional<Dictionary> SharedDataStore::dictionary(const String& token) const {
  const auto shared = byToken_.find(token.view());
  if (shared == byToken_.end()) return std::nullopt;
  return shared->second.values;
}

uint64_t SharedDataStore::bytesOfUser(uint32_t user) const {
  return budget_.account(user)->holds(Share::sharedDataBytes);
}

// Room for `added` bytes once `credited` are given back, which credit() does.
bool SharedDataStore::take(UserAccount& account, uint64_t added, uint64_t credited) {
  account.giveBack(Share::sharedDataBytes, credited);
  const bool fits = account.take(Share::sharedDataBytes, added);
  account.takeAnyway(Share::sharedDataBytes, credited);
  if (!fits) return false;
  account.giveBack(Share::bytes, credited);
  const bool hasMemory = account.take(Share::bytes, added, kLeftForMessages);
  account.takeAnyway(Share::bytes, credited);
  if (!hasMemory) account.giveBack(Share::sharedDataBytes, added);
  return hasMemory;
}

void SharedDataStore::credit(const Charge& charge) {
  if (charge.bytes == 0) return;
  const std::shared_ptr<UserAccount> account = budget_.account(charge.user);
  account->giveBack(Share::sharedDataBytes, charge.bytes);
  account->giveBack(Share::bytes, charge.bytes);
}

}  // namespace kyt
