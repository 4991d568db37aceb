// kytsource-units: see UnitFindings.h.
#include "sources/units/UnitFindings.h"

int main(int argc, char** argv) {
  return kyt::sources::runJournalProgram(kyt::sources::unitsProgram(), argc, argv);
}
