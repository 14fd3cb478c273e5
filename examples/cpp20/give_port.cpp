// give_port FILE NAME: prints the port that the service has in the services file FILE, after adding
// the service at a free one if it has none.
#include <exception>
#include <iostream>
#include <osutils.hpp>
#include <string>
#include <system_error>

using VRAOSUtils::EtcServices;

namespace {

void require(int code, const std::string& what) {
  if (const std::error_code error = osutils::errorCode(code)) throw std::system_error(error, what);
}

int givePort(const std::string& file, const std::string& name) {
  EtcServices::ETC_SERVICES_FILE = file.c_str();  // read by the constructor
  EtcServices services;
  require(services.readEtcServices(), file);
  if (!services.doesServiceExist(name.c_str())) {
    const int port = services.findAvaliablePort(EtcServices::INIT_PORT_INDEX);
    require(services.addService(name.c_str(), port), name);
  }
  return services.getServicePort(name.c_str());
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 3) {
    std::cerr << "usage: give_port FILE NAME\n";
    return 2;
  }
  try {
    std::cout << givePort(argv[1], argv[2]) << '\n';
    return 0;
  } catch (const std::exception& failure) {
    std::cerr << "give_port: " << failure.what() << '\n';
    return 1;
  }
}
