#include <osutils.h>

#include <cstdio>

int main() {
  using VRAOSUtils::EtcServices;
  EtcServices::ETC_SERVICES_FILE = "services.example";  // before the object is made
  EtcServices::ETC_SERVICES_FILE_BACKUP = "services.example.save";
  clearFile(EtcServices::ETC_SERVICES_FILE);

  EtcServices services;
  if (services.readEtcServices() != OSUTILS_SUCCESS) return 1;
  const int port = services.findAvaliablePort(EtcServices::INIT_PORT_INDEX);
  std::printf("add: %d\n", services.addService("vraslapd", port));
  std::printf("port: %d\n", services.getServicePort("vraslapd"));
  std::printf("delete: %d\n", services.deleteService("vraslapd"));
  return 0;
}

// Prints:
// add: 0
// port: 3700
// delete: 0
