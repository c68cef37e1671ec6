// libFuzzer entry of every target, its check named at build time: any property broken by an
// input ends the run with what broke.
#include <stdio.h>
#include <stdlib.h>

#include "tests/fuzz/bus_statement_checks.h"
#include "tests/fuzz/fuzz_checks.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::string failed = fuzz_checks::LOGMGR_FUZZ_CHECK(data, size);
  if (!failed.empty()) {
    fprintf(stderr, "property broken: %s\n", failed.c_str());
    abort();
  }
  return 0;
}
