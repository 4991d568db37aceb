// kytsource-crashes: see CrashFindings.h.
#include "sources/crashes/CrashFindings.h"

int main(int argc, char** argv) {
  return kyt::sources::runJournalProgram(kyt::sources::crashesProgram(), argc, argv);
}
