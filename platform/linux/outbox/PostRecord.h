// The text of a post's row in the outbox's file: all but its number and its body, each field with its length before it.
// Reading trusts nothing: what does not fit is no post.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/PostStore.h"

namespace kyt {

[[nodiscard]] std::string postRecord(const StoredPost& post);
// Number and body stay empty.
[[nodiscard]] std::optional<StoredPost> readPostRecord(std::string_view record);
// Of number and record, so that what is known of a post before its body is read is what was kept.
[[nodiscard]] uint64_t postHeadChecksum(int64_t number, std::string_view record);
// Of record and body, so that no byte of them is sent that was not kept (FNV-1a).
[[nodiscard]] uint64_t postChecksum(std::string_view record, std::string_view body);

}  // namespace kyt
