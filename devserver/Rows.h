// Posts, events and fetches as the JSON that queries answer and pages are told, from the database's rows and
// from what was just written. Functions without state.
#pragma once

#include <string>

#include "devserver/Database.h"
#include "devserver/JsonText.h"
#include "devserver/Post.h"
#include "devserver/Store.h"

namespace kyt::devserver {

// The columns of a post that postMembers reads, in its order; seventeen of them.
inline constexpr char kPostColumns[] =
    "id, received, secure, http_method, path, client, service, sender, good, reason, digest, answered, "
    "client_id, "
    "post_time, size, text_size, events, sha256, repeats";

// A member that is null where the column is.
void optionalNumber(JsonText& out, const char* name, const Statement& row, int column);
void optionalReal(JsonText& out, const char* name, const Statement& row, int column);

// The members of a post, without headers and body, into an open object.
void postMembers(JsonText& out, const Statement& row);
void postMembers(JsonText& out, const Post& post);

// Whole objects. The row of an event: id, post, received, client, service, sender, method, status, session,
// number, time, record.
void eventObject(JsonText& out, const Event& event, const Post& post);
void eventObject(JsonText& out, const Statement& row);
void fetchObject(JsonText& out, const Fetch& fetch);

void arrivalObject(JsonText& out, const Arrival& arrival);

[[nodiscard]] std::string totalsAsJson(const Totals& totals);

// What pages are told about a transaction: its posts, fetches and the last of its events.
[[nodiscard]] std::string commitAsJson(const Commit& commit);

}  // namespace kyt::devserver
