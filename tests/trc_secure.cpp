// Loads the trace library that its argument names and writes a record with it. The test makes this program
// set-group-ID, so the loader would ignore a search path in it.
#include <dlfcn.h>
#include <stdint.h>
#include <sys/auxv.h>

// Returns 0 if the program was privileged and no event is switched on, 2 if it was not privileged.
int main(int, char** argv) {
  void* const library = dlopen(argv[1], RTLD_NOW);
  if (library == nullptr) return 1;
  using WriteRec = void(uint64_t, uint64_t, const void*, uint64_t, const void*, uint64_t, uint64_t,
                        uint64_t, uint64_t);
  auto* const write_rec = reinterpret_cast<WriteRec*>(dlsym(library, "trcWriteRec"));
  const auto* const events = static_cast<const uint64_t*>(dlsym(library, "trcEvents"));
  if (write_rec == nullptr || events == nullptr) return 1;
  write_rec(0x3200000, 0x3E060100, nullptr, 0, nullptr, 0, 0, 0, 0);
  if (getauxval(AT_SECURE) == 0) return 2;
  return *events == 0 ? 0 : 3;
}
