#include "platform/linux/outbox/SQLiteLibrary.h"

#include "platform/linux/base/SharedLibrary.h"

namespace kyt {

std::variant<SQLiteLibrary, std::string> SQLiteLibrary::load(const char* name) {
  SharedLibrary sqlite(name);
  SQLiteLibrary functions;
#define ROW(here, there) sqlite.resolve(functions.here, #there);
  KYT_SQLITE_FUNCTIONS(ROW)
#undef ROW
  if (sqlite.problem()) return *sqlite.problem();
  return functions;
}

}  // namespace kyt
