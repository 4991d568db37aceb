// Looks at the session's information for what means nothing here: keys that nobody knows, and values of another
// type than their key's. A misspelt "RequireUserInfo" or a text "on" takes a session out of the consent's reach
// without a word. It is deliberately only counted and told: such a session is served as it always was. Any thread.
#pragma once

namespace kyt {

class Dictionary;
struct Platform;

void countMistakes(const Dictionary& sessionInfo, Platform& platform);

}  // namespace kyt
