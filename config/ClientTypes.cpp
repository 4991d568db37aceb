#include "config/ClientTypes.h"

namespace kyt {

namespace {

struct ClientType {
  const char* shortCode;
  const char* storebagName;  // null: none
};

constexpr ClientType kClientTypes[kNumberOfClientTypes] = {
    {"QA", nullptr},    {"QB", nullptr},     {"QCX", nullptr},       {"QD", nullptr},
    {"QE", nullptr},    {"QF", "torvel"},    {"QG", "brisca"},       {"QH", "cadmor"},
    {"QJ", "dulvek"},   {"QK", "emrit"},     {"QL", "fosska"},       {"QM", "cadmor"},
    {"QNPA", "gelmar"}, {"QPRAV", "cadmor"}, {"QG-TRS", "brisca"},   {"QG-VELMO", "brisca"},
    {"HOVIT", "hovit"}, {"QUTRIN", "ismel"}, {"QWERNOLT", "jorvan"}, {"QN", "kelvit"},
    {"QPW", "cadmor"},  {"QS", "lurra"},     {"QT", "morvek"},       {"QV", "nessim"},
};

const ClientType* clientType(int32_t type) {
  return type >= 0 && type < kNumberOfClientTypes ? &kClientTypes[type] : nullptr;
}

}  // namespace

std::optional<String> storebagNameForClientType(int32_t type) {
  const ClientType* entry = clientType(type);
  if (entry == nullptr || entry->storebagName == nullptr) return std::nullopt;
  return String(entry->storebagName);
}

const char* clientTypeShortCode(int32_t type) {
  const ClientType* entry = clientType(type);
  return entry != nullptr ? entry->shortCode : "Unknown";
}

}  // namespace kyt
