// A channel file belongs to the process that publishes it, which may be wrong,
// hostile or gone: nothing in it is believed before it is checked, and it is read
// by `pread` since a mapping of a file that somebody cuts short ends the reader.
// A counter is eight aligned bytes, which the kernel copies as one.
#include "platform/linux/ChannelFile.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "platform/linux/ChannelFileFormat.h"
#include "platform/linux/FileDescriptor.h"
#include "platform/linux/Places.h"
#include "platform/linux/SmallFile.h"
#include "platform/linux/wire/PayloadDecoder.h"

namespace ostrel {
namespace {

using channels::Header;
using channels::Record;

// 0, or the error; EBADMSG when there are fewer bytes.
int readWhole(int file, void* to, std::size_t size, std::size_t offset) {
  auto* bytes = static_cast<char*>(to);
  while (size != 0) {
    const ssize_t more = ::pread(file, bytes, size, static_cast<off_t>(offset));
    if (more == 0) return EBADMSG;
    if (more < 0 && errno != EINTR) return errno;
    if (more < 0) continue;
    bytes += more;
    size -= static_cast<std::size_t>(more);
    offset += static_cast<std::size_t>(more);
  }
  return 0;
}

// The text in a field that ends with NUL; none when it does not, or is not UTF-8.
template <std::size_t size>
std::optional<std::string> textOf(const char (&field)[size]) {
  const void* end = std::memchr(field, 0, size);
  if (end == nullptr) return std::nullopt;
  const std::string text(field, static_cast<const char*>(end));
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(text.data());
  if (!wire::isUTF8({bytes, text.size()})) return std::nullopt;
  return text;
}

int checkHeader(const Header& header, std::size_t size, const std::string& path) {
  if (std::memcmp(header.magic, channels::kMagic, sizeof header.magic) != 0 ||
      header.version != channels::kVersion) {
    return EBADMSG;
  }
  if (header.capacity > channels::kMostCounters) return EFBIG;
  if (header.count > header.capacity || size < channels::fileBytes(header.capacity)) {
    return EBADMSG;
  }
  const auto group = textOf(header.group);
  const auto subgroup = textOf(header.subgroup);
  const auto name = path.substr(path.rfind('/') + 1);
  return group && subgroup && name == channels::fileName(*group, *subgroup) ? 0 : EBADMSG;
}

// Appends the counters to `values`; 0, or the error.
int readFile(const std::string& path, std::vector<ChannelValue>& values) {
  const FileDescriptor file(
      ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY));
  struct stat status {};
  if (!file || ::fstat(file.get(), &status) != 0) return errno;
  if (!S_ISREG(status.st_mode)) return EINVAL;
  Header header{};
  if (const int error = readWhole(file.get(), &header, sizeof header, /*offset=*/0)) {
    return error;
  }
  if (const int error =
          checkHeader(header, static_cast<std::size_t>(status.st_size), path)) {
    return error;
  }
  std::vector<Record> records(header.count);
  if (const int error = readWhole(file.get(), records.data(),
                                  records.size() * sizeof(Record), sizeof header)) {
    return error;
  }
  values.reserve(records.size());
  for (const Record& record : records) {
    auto name = textOf(record.name);
    if (!name || name->empty()) return EBADMSG;
    values.push_back({std::move(*name), record.value});
  }
  return 0;
}

class ChannelFileSource final : public ChannelSource {
 public:
  explicit ChannelFileSource(std::string path) : path_(std::move(path)) {}

  const std::string& identifier() const override { return path_; }
  Outcome<std::vector<ChannelValue>> read() const override {
    return readChannelFile(path_);
  }

 private:
  const std::string path_;
};

bool isOfName(const std::optional<std::string>& wanted, const std::string& name) {
  return !wanted || *wanted == name;
}

}  // namespace

Outcome<std::vector<ChannelValue>> readChannelFile(const std::string& path) {
  std::vector<ChannelValue> values;
  if (const int error = readFile(path, values); error != 0) {
    return {std::nullopt, errorOfPath(error, path)};
  }
  return {std::move(values), std::nullopt};
}

std::string ChannelFileFinder::systemDirectory() {
  return runtimeDirectory() + "/channels";
}

ChannelFinder::Found ChannelFileFinder::find(
    const std::optional<std::string>& group,
    const std::optional<std::string>& subgroup) const {
  Found found;
  const std::unique_ptr<DIR, int (*)(DIR*)> directory(::opendir(directory_.c_str()),
                                                      &::closedir);
  if (!directory) {
    if (errno != ENOENT) found.error = errorOfPath(errno, directory_);
    return found;
  }
  std::vector<std::string> names;
  std::size_t seen = 0;
  while (const dirent* entry = ::readdir(directory.get())) {
    if (++seen > kMostFiles) {
      found.error = errorOfPath(EFBIG, directory_);
      break;
    }
    const auto of = channels::namesOfFile(entry->d_name);
    if (of && isOfName(group, of->group) && isOfName(subgroup, of->subgroup)) {
      names.emplace_back(entry->d_name);
    }
  }
  std::sort(names.begin(), names.end());
  for (const std::string& name : names) {
    auto source = std::make_shared<ChannelFileSource>(directory_ + "/" + name);
    if (auto read = source->read(); read.value) {
      found.sources.push_back(std::move(source));
    } else if (!found.error) {
      found.error = std::move(read.error);
    }
  }
  return found;
}

}  // namespace ostrel
