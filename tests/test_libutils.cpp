#include <dlfcn.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>

#include <functional>
#include <string>
#include <thread>
#include <type_traits>

#include "faults.h"
#include "ldtr.h"
#include "osutils.h"
#include "records.h"
#include "world.h"

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

namespace {

// Installed with the C library, and not loaded by this program.
constexpr char kLibrary[] = "libresolv.so.2";
constexpr char kSymbol[] = "ns_sprintrr";
constexpr char kMissing[] = "/nonexistent/libnone.so";

// Runs the body in a child process, so that no other test sees what it loads.
void inChildExpecting(const std::function<void()>& body) {
  EXPECT_EQ(inChild([&] {
              body();
              return 0;
            }),
            0);
}

bool isLoaded(const char* library) {
  void* const handle = dlopen(library, RTLD_LAZY | RTLD_NOLOAD);
  if (handle != nullptr) dlclose(handle);
  return handle != nullptr;
}

// The loader's own error text.
std::string loaderError(const char* library, int mode) {
  EXPECT_EQ(dlopen(library, mode), nullptr);
  const char* const text = dlerror();
  return text != nullptr ? text : "(none)";
}

std::string failure(const std::string& library, int mode, const std::string& error) {
  return "E ldapLoadLib: dlopen(" + library + "," + std::to_string(mode) +
         ") failed with error: " + error + ".\n";
}

#define REQUIRE_FREE_LIBRARY() \
  if (isLoaded(kLibrary)) GTEST_SKIP() << kLibrary << " is part of this program"

// ---- defFlags ----

TEST(DefFlags, AreNowAndGlobalAtFirst) {
  EXPECT_EQ(defFlags, 258);
  EXPECT_EQ(defFlags, RTLD_NOW | RTLD_GLOBAL);
  static_assert(std::is_same_v<decltype(defFlags), int>);
}

TEST(DefFlags, AreReadAtEachCallThatAsksForTheDefault) {
  inChildExpecting([] {
    const std::string lazy = loaderError(kMissing, RTLD_LAZY);
    const Records records;

    defFlags = RTLD_LAZY;
    EXPECT_EQ(loadSharedLib(kMissing, 0), nullptr);
    defFlags = RTLD_NOW;
    EXPECT_EQ(loadSharedLib(kMissing, 0), nullptr);

    EXPECT_THAT(records.trail(),
                ElementsAre("> loadSharedLib", failure(kMissing, 1, lazy), "< loadSharedLib 0",
                            "> loadSharedLib", failure(kMissing, 2, lazy), "< loadSharedLib 0"));
  });
}

TEST(DefFlags, MakeTheSymbolsVisibleToLibrariesLoadedLater) {
  REQUIRE_FREE_LIBRARY();
  inChildExpecting([] {
    ASSERT_EQ(dlsym(RTLD_DEFAULT, kSymbol), nullptr);

    SharedLibHandle* const lib = loadSharedLib(kLibrary, 0);

    ASSERT_NE(lib, nullptr);
    EXPECT_NE(dlsym(RTLD_DEFAULT, kSymbol), nullptr);
    EXPECT_EQ(unloadSharedLib(lib), 0);
  });
}

// ---- loadSharedLib ----

TEST(LoadSharedLib, LoadsALibraryAndSaysNothing) {
  REQUIRE_FREE_LIBRARY();
  inChildExpecting([] {
    const Records records;

    SharedLibHandle* const lib = loadSharedLib(kLibrary, RTLD_NOW);

    EXPECT_THAT(records.trail(), ElementsAre("> loadSharedLib", "< loadSharedLib 0"));
    ASSERT_NE(lib, nullptr);
    EXPECT_TRUE(isLoaded(kLibrary));
    EXPECT_EQ(unloadSharedLib(lib), 0);
  });
}

TEST(LoadSharedLib, HandsTheModeToTheLoader) {
  REQUIRE_FREE_LIBRARY();
  inChildExpecting([] {
    SharedLibHandle* const lib = loadSharedLib(kLibrary, RTLD_LAZY);

    ASSERT_NE(lib, nullptr);
    // Without RTLD_GLOBAL other objects do not see the library's symbols.
    EXPECT_EQ(dlsym(RTLD_DEFAULT, kSymbol), nullptr);
    EXPECT_NE(getSymAddress(lib, kSymbol), nullptr);
    EXPECT_EQ(unloadSharedLib(lib), 0);
  });
}

// libosutils.so calls the loader, so its folder and its run-time path count, not the program's.
TEST(LoadSharedLib, LooksForTheFileFromTheLibrarysOwnPlace) {
  if (sanitizerOwnsMalloc()) GTEST_SKIP() << "the sanitizer asks the loader in the library's place";
  constexpr char kBeside[] = "$ORIGIN/libosutils.so";
  ASSERT_EQ(dlopen(kBeside, RTLD_NOW), nullptr) << "the library lies in this program's folder";
  for (const char* const name : {kBeside, "libosutils.so"}) {
    SCOPED_TRACE(name);

    SharedLibHandle* const lib = loadSharedLib(name, RTLD_NOW);

    ASSERT_NE(lib, nullptr) << dlerror();
    EXPECT_EQ(getSymAddress(lib, "loadSharedLib"), reinterpret_cast<void*>(&loadSharedLib));
    EXPECT_EQ(unloadSharedLib(lib), 0);
  }
}

TEST(LoadSharedLib, OfAMissingFileReportsTheDefaultModeAndTheLoadersText) {
  const std::string error = loaderError(kMissing, 258);
  ASSERT_THAT(error, HasSubstr(kMissing));
  const Records records;

  EXPECT_EQ(loadSharedLib(kMissing, 0), nullptr);

  EXPECT_THAT(records.trail(),
              ElementsAre("> loadSharedLib", failure(kMissing, 258, error), "< loadSharedLib 0"));
}

TEST(LoadSharedLib, OfAMissingFileReportsTheModeOfTheCall) {
  const std::string error = loaderError(kMissing, RTLD_LAZY);
  const Records records;

  EXPECT_EQ(loadSharedLib(kMissing, RTLD_LAZY), nullptr);

  EXPECT_THAT(records.trail(),
              ElementsAre("> loadSharedLib", failure(kMissing, 1, error), "< loadSharedLib 0"));
}

TEST(LoadSharedLib, OfAFileThatIsNotALibraryReportsIt) {
  const TempDir temp;
  const std::string text = temp.file("libtext.so", "no library\n");
  const std::string error = loaderError(text.c_str(), 258);
  const Records records;

  EXPECT_EQ(loadSharedLib(text.c_str(), 0), nullptr);

  EXPECT_THAT(records.trail(),
              ElementsAre("> loadSharedLib", failure(text, 258, error), "< loadSharedLib 0"));
}

TEST(LoadSharedLib, OfAMissingFileTakesTheLoadersErrorForTheMessage) {
  (void)dlerror();
  const Records records;

  EXPECT_EQ(loadSharedLib(kMissing, 0), nullptr);

  EXPECT_EQ(dlerror(), nullptr);
}

TEST(LoadSharedLib, LeavesTheLoadersErrorPendingWhenDebugIsOff) {
  (void)dlerror();
  const Records records(kAllEvents & ~kDebug);

  EXPECT_EQ(loadSharedLib(kMissing, 0), nullptr);

  EXPECT_THAT(records.trail(), ElementsAre("> loadSharedLib", "< loadSharedLib 0"));
  const char* const pending = dlerror();
  ASSERT_NE(pending, nullptr);
  EXPECT_THAT(pending, HasSubstr(kMissing));
}

TEST(LoadSharedLib, OfANullNameSaysSoAndLoadsTheProgramItself) {
  const Records records;

  SharedLibHandle* const lib = loadSharedLib(nullptr, 0);

  EXPECT_THAT(records.trail(),
              ElementsAre("> loadSharedLib", "D loadSharedLib: passed a null pointer.\n",
                          "< loadSharedLib 0"));
  ASSERT_NE(lib, nullptr);
  EXPECT_EQ(getSymAddress(lib, "trcEvents"), &trcEvents);  // this program's own
  EXPECT_EQ(unloadSharedLib(lib), 0);
}

TEST(LoadSharedLib, OfANullNameThatTheLoaderRefusesReportsBoth) {
  constexpr int kNeitherLazyNorNow = RTLD_GLOBAL;
  const std::string error = loaderError(nullptr, kNeitherLazyNorNow);
  const Records records;

  EXPECT_EQ(loadSharedLib(nullptr, kNeitherLazyNorNow), nullptr);

  EXPECT_THAT(records.trail(),
              ElementsAre("> loadSharedLib", "D loadSharedLib: passed a null pointer.\n",
                          failure("(null)", 256, error), "< loadSharedLib 0"));
}

TEST(LoadSharedLib, WithoutMemoryLoadsNothing) {
  REQUIRE_OWN_MALLOC();
  REQUIRE_FREE_LIBRARY();
  const Records records;
  FailingCall allocation(Call::malloc, ENOMEM);

  SharedLibHandle* const lib = loadSharedLib(kLibrary, 0);
  allocation.disarm();

  EXPECT_TRUE(allocation.fired());
  EXPECT_EQ(lib, nullptr);
  EXPECT_FALSE(isLoaded(kLibrary));
  EXPECT_THAT(records.trail(),
              ElementsAre("> loadSharedLib", "D loadSharedLib: unable to allocate memory.\n",
                          "< loadSharedLib 0"));
}

TEST(LoadSharedLib, OfANullNameWithoutMemoryReportsBothInThisOrder) {
  REQUIRE_OWN_MALLOC();
  const Records records;
  FailingCall allocation(Call::malloc, ENOMEM);

  SharedLibHandle* const lib = loadSharedLib(nullptr, 0);
  allocation.disarm();

  EXPECT_TRUE(allocation.fired());
  EXPECT_EQ(lib, nullptr);
  EXPECT_THAT(records.trail(),
              ElementsAre("> loadSharedLib", "D loadSharedLib: passed a null pointer.\n",
                          "D loadSharedLib: unable to allocate memory.\n", "< loadSharedLib 0"));
}

TEST(LoadSharedLib, ThatFailsLeavesNothingAllocated) {
  REQUIRE_OWN_MALLOC();
  const LiveAllocations live;
  const FailingCall watch(Call::malloc, 0, 2);  // counts them

  EXPECT_EQ(loadSharedLib(kMissing, 0), nullptr);

  EXPECT_EQ(watch.calls(), 1);
  EXPECT_EQ(live.blocks(), 0);
}

// ---- unloadSharedLib ----

TEST(UnloadSharedLib, UnloadsTheLibraryAndSaysNothing) {
  REQUIRE_FREE_LIBRARY();
  inChildExpecting([] {
    SharedLibHandle* const lib = loadSharedLib(kLibrary, RTLD_NOW);
    ASSERT_NE(lib, nullptr);
    const Records records;

    EXPECT_EQ(unloadSharedLib(lib), 0);

    EXPECT_THAT(records.trail(), ElementsAre("> unloadSharedLib", "< unloadSharedLib 0"));
    EXPECT_FALSE(isLoaded(kLibrary));
  });
}

TEST(UnloadSharedLib, ReleasesTheRecord) {
  REQUIRE_OWN_MALLOC();
  const LiveAllocations live;
  SharedLibHandle* const lib = loadSharedLib(nullptr, 0);
  ASSERT_EQ(live.blocks(), 1);

  EXPECT_EQ(unloadSharedLib(lib), 0);

  EXPECT_EQ(live.blocks(), 0);
}

TEST(UnloadSharedLib, OfALibraryLoadedTwiceLeavesItToTheOther) {
  REQUIRE_FREE_LIBRARY();
  inChildExpecting([] {
    SharedLibHandle* const first = loadSharedLib(kLibrary, RTLD_NOW);
    SharedLibHandle* const second = loadSharedLib(kLibrary, RTLD_NOW);
    ASSERT_NE(first, nullptr);
    ASSERT_NE(second, nullptr);
    EXPECT_NE(first, second);

    EXPECT_EQ(unloadSharedLib(first), 0);
    EXPECT_TRUE(isLoaded(kLibrary));
    EXPECT_EQ(unloadSharedLib(second), 0);
    EXPECT_FALSE(isLoaded(kLibrary));
  });
}

TEST(UnloadSharedLib, AnswersSuccessWhenTheLoaderRefuses) {
  SharedLibHandle* const lib = loadSharedLib(nullptr, 0);
  const Records records;

  FailingCall close(Call::dlclose, EIO);
  const int answer = unloadSharedLib(lib);
  close.disarm();

  EXPECT_EQ(close.calls(), 1);
  EXPECT_EQ(answer, 0);
  EXPECT_THAT(records.trail(), ElementsAre("> unloadSharedLib", "< unloadSharedLib 0"));
}

TEST(UnloadSharedLib, OfALibraryThatWaitsAtItsEndIsNotCancelled) {
  inChildExpecting([] {
    bool is_unloaded = false;
    std::thread([&] {
      SharedLibHandle* const lib = loadSharedLib(CANCELLATION_POINT, RTLD_NOW);
      ASSERT_NE(lib, nullptr);
      EXPECT_EQ(pthread_cancel(pthread_self()), 0);
      is_unloaded = unloadSharedLib(lib) == OSUTILS_SUCCESS;
    }).join();
    EXPECT_TRUE(is_unloaded);
    EXPECT_FALSE(isLoaded(CANCELLATION_POINT));
  });
}

TEST(UnloadSharedLib, OfANullRecordAnswersOtherAndRecordsNoCode) {
  const Records records;

  EXPECT_EQ(unloadSharedLib(nullptr), 80);

  EXPECT_THAT(records.trail(),
              ElementsAre("> unloadSharedLib", "D unloadSharedLib: passed a null pointer.\n",
                          "< unloadSharedLib 0"));
}

// ---- getSymAddress ----

class SymAddress : public testing::Test {
 protected:
  SymAddress() : lib(loadSharedLib(nullptr, 0)) {}
  ~SymAddress() override { EXPECT_EQ(unloadSharedLib(lib), 0); }

  SharedLibHandle* const lib;
};

TEST_F(SymAddress, OfAFunctionIsTheFunction) {
  const Records records;

  void* const address = getSymAddress(lib, "unloadSharedLib");

  EXPECT_THAT(records.trail(), ElementsAre("> getSymAddress", "< getSymAddress 0"));
  EXPECT_EQ(address, reinterpret_cast<void*>(&unloadSharedLib));
}

TEST_F(SymAddress, OfAVariableIsTheVariable) {
  EXPECT_EQ(getSymAddress(lib, "defFlags"), &defFlags);
}

TEST_F(SymAddress, OfAnAbsentSymbolIsNullWithoutAMessage) {
  const Records records;

  EXPECT_EQ(getSymAddress(lib, "no_such_symbol_anywhere"), nullptr);

  EXPECT_THAT(records.trail(), ElementsAre("> getSymAddress", "< getSymAddress 0"));
}

TEST_F(SymAddress, OfTheEmptyNameIsNull) { EXPECT_EQ(getSymAddress(lib, ""), nullptr); }

TEST_F(SymAddress, OfANullNameIsRefused) {
  const Records records;

  EXPECT_EQ(getSymAddress(lib, nullptr), nullptr);

  EXPECT_THAT(records.trail(),
              ElementsAre("> getSymAddress", "D getSymAddress: passed a null pointer.\n",
                          "< getSymAddress 0"));
}

TEST_F(SymAddress, WithANullRecordIsRefused) {
  const Records records;

  EXPECT_EQ(getSymAddress(nullptr, "defFlags"), nullptr);

  EXPECT_THAT(records.trail(),
              ElementsAre("> getSymAddress", "D getSymAddress: passed a null pointer.\n",
                          "< getSymAddress 0"));
}

TEST(SharedLibs, LeaveNoRecordsWhileTracingIsOff) {
  const Records records(0);

  EXPECT_EQ(loadSharedLib(kMissing, 0), nullptr);
  SharedLibHandle* const lib = loadSharedLib(nullptr, 0);
  EXPECT_EQ(getSymAddress(nullptr, "defFlags"), nullptr);
  EXPECT_EQ(getSymAddress(lib, "defFlags"), &defFlags);
  EXPECT_EQ(unloadSharedLib(lib), 0);
  EXPECT_EQ(unloadSharedLib(nullptr), 80);

  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

}  // namespace
