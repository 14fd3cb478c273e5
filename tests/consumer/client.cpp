// A C++17 program that uses only the installed library: client FILE, a services file with demo at 3700.
#include <cstdio>
#include <osutils.hpp>

using VRAOSUtils::EtcServices;

int main(int argc, char** argv) {
  if (argc != 2) return 2;

  EtcServices::ETC_SERVICES_FILE = argv[1];
  EtcServices services;
  const bool works = services.readEtcServices() == OSUTILS_SUCCESS &&
                     services.getServicePort("demo") == 3700 &&
                     services.findAvaliablePort(EtcServices::INIT_PORT_INDEX) == 3701 &&
                     osutils::formatDn("cn=a") == "CN=A";
  std::puts(works ? "C++ client: works" : "C++ client: wrong answer");
  return works ? 0 : 1;
}
