// Shared libraries, and the platform's name.

#include <dlfcn.h>

#include <fstream>

#include "ldtr.h"
#include "osutils.h"
#include "scenario.h"

namespace scenarios {
namespace {

constexpr const char kMath[] = "libm.so.6";

std::string shownHandle(SharedLibHandle* library) {
  if (library == nullptr) return "null";
  return unloadSharedLib(library) == OSUTILS_SUCCESS ? "loaded" : "not unloaded";
}

Scenario load(const std::string& variant, std::function<const char*()> file, int mode,
              std::vector<End> ends) {
  return {.name = "loadSharedLib" + variant,
          .symbols = {"loadSharedLib", "unloadSharedLib"},
          .prepare = [] { std::ofstream(path("text.so")) << "text"; },
          .run = [=] { return shownHandle(loadSharedLib(file(), mode)); },
          .ends = std::move(ends)};
}

// With debug tracing off the loader's text is left for the caller.
std::string loadedWithoutTracing() {
  const uint64_t events = trcEvents;
  trcEvents = 0;
  (void)dlerror();
  const std::string result = shownHandle(loadSharedLib("/osu/missing.so", 0));
  trcEvents = events;
  return result + (dlerror() == nullptr ? ", no error" : ", error");
}

std::string address(const char* file, const char* symbol, const void* expected) {
  SharedLibHandle* const library = loadSharedLib(file, RTLD_NOW);
  void* const found = getSymAddress(library, symbol);
  const std::string loaded = shownHandle(library);
  return loaded + (found == nullptr ? ", null" : found == expected ? ", found" : ", another");
}

}  // namespace

std::vector<Scenario> libraryScenarios() {
  const std::vector<End> loads = {{kNothing, "loaded"}, {kMemory | kLibrary, "null"}};
  const std::vector<End> finds = {
      {kNothing, "loaded, found"}, {kMemory | kLibrary, "null, null"}, {kLibrary, "loaded, null"}};
  const std::vector<End> loads_only = {{kNothing, "loaded, null"},
                                       {kMemory | kLibrary, "null, null"}};
  const std::vector<std::string> lookup = {"getSymAddress"};
  return {
      load(
          "", [] { return kMath; }, 0, loads),
      load(
          ", lazily", [] { return kMath; }, RTLD_LAZY, loads),
      load(
          ", the program", [] { return nullptr; }, 0, loads),
      load(", missing", [] { return path("missing.so"); }, 0, {{kNothing, "null"}}),
      load(", no library", [] { return path("text.so"); }, RTLD_LAZY, {{kNothing, "null"}}),
      {.name = "loadSharedLib, missing, without tracing",
       .symbols = {"loadSharedLib"},
       .run = loadedWithoutTracing,
       .ends = {{kNothing, "null, error"}, {kMemory | kLibrary, "null, no error"}}},
      {.name = "unloadSharedLib, null",
       .symbols = {"unloadSharedLib"},
       .run = [] { return shown(unloadSharedLib(nullptr)); },
       .ends = {{kNothing, "80"}}},
      {.name = "getSymAddress",
       .symbols = lookup,
       .run = [] { return address(nullptr, "getOSname", reinterpret_cast<void*>(getOSname)); },
       .ends = finds},
      {.name = "getSymAddress, absent",
       .symbols = lookup,
       .run = [] { return address(kMath, "osu_absent", nullptr); },
       .ends = loads_only},
      {.name = "getSymAddress, null symbol",
       .symbols = lookup,
       .run = [] { return address(kMath, nullptr, nullptr); },
       .ends = loads_only},
      {.name = "getSymAddress, null handle",
       .symbols = lookup,
       .run = [] { return getSymAddress(nullptr, "cos") == nullptr ? "null" : "found"; },
       .ends = {{kNothing, "null"}}},
      {.name = "getOSname",
       .symbols = {"getOSname"},
       .run =
           [] {
             const char* const name = getOSname();
             return std::string(name) + (getOSname() == name ? ", the same" : ", another");
           },
       .ends = {{kNothing, "Linux-x64, the same"}}},
  };
}

}  // namespace scenarios
