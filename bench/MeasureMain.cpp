// The main function of programs that measure pieces (Measure.h).
#include "bench/Measure.h"

int main(int argc, char** argv) {
  return kyt::bench::runPieces(argc, argv);
}
