#include <osutils.h>

#include <cstdio>
#include <cstdlib>

int main() {
  using VRAOSUtils::EtcInittab;
  EtcInittab::ETC_INITTAB_FILE = "inittab.example";  // before the object is made
  EtcInittab::ETC_INITTAB_FILE_BACKUP = "inittab.example.save";
  clearFile(EtcInittab::ETC_INITTAB_FILE);

  EtcInittab inittab;
  if (inittab.readInittab() != OSUTILS_SUCCESS) return 1;
  char* id = inittab.findAvaliableID();
  if (id == nullptr) return 1;
  std::printf("add: %d\n", inittab.addInittabEntry(id, "2345", "respawn", "/opt/tool/serve"));
  std::printf("registered: %d\n", inittab.isCommandRegistered("/opt/tool/serve"));
  std::printf("delete: %d\n", inittab.deleteInittabEntry(id));
  std::free(id);
  return 0;
}

// Prints:
// add: 0
// registered: 1
// delete: 0
