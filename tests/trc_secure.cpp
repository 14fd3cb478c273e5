// Loads the trace library given as its argument and writes a record with it. The test gives this program
// more rights than its user has, which is why it cannot find the library by itself: the loader does not
// trust a path of a privileged program either.
#include <dlfcn.h>
#include <stdint.h>
#include <sys/auxv.h>

// Answers 0 when the program was privileged and no event is switched on; 2 when it was not privileged.
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
