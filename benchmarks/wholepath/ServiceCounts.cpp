#include "benchmarks/wholepath/ServiceCounts.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>

namespace ostrel::bench {

ServiceCounts& mapServiceCounts(const std::string& path) {
  const int file = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  if (file < 0 || ::ftruncate(file, sizeof(ServiceCounts)) != 0) {
    std::perror(path.c_str());
    std::exit(EXIT_FAILURE);
  }
  void* const at = ::mmap(/*addr=*/nullptr, sizeof(ServiceCounts), PROT_READ | PROT_WRITE,
                          MAP_SHARED, file, /*offset=*/0);
  ::close(file);
  if (at == MAP_FAILED) {
    std::perror(path.c_str());
    std::exit(EXIT_FAILURE);
  }
  return *static_cast<ServiceCounts*>(at);
}

}  // namespace ostrel::bench
