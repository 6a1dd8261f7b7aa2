// Publishes counters in channel files. Only a file that nobody but this user can
// write is mapped: whoever can cut a file short can end every process that maps
// it. Room is allocated before the file gets its name, so that no full file system
// ends a process later.
#include <fcntl.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <mutex>
#include <new>
#include <string>
#include <string_view>

#include "ostrel/channels.h"
#include "platform/linux/ChannelFileFormat.h"
#include "platform/linux/FileDescriptor.h"
#include "platform/linux/Places.h"
#include "platform/linux/wire/PayloadDecoder.h"

using ostrel::FileDescriptor;
using ostrel::channels::fileBytes;
using ostrel::channels::Header;
using ostrel::channels::Record;

static_assert(OSTREL_CHANNELS_MOST_GROUP_BYTES == ostrel::channels::kGroupBytes - 1);
static_assert(OSTREL_CHANNELS_MOST_NAME_BYTES == ostrel::channels::kNameBytes - 1);
static_assert(OSTREL_CHANNELS_MOST_COUNTERS == ostrel::channels::kMostCounters);

struct ostrel_counter {
  std::int64_t value;
};

struct ostrel_channels {
  ~ostrel_channels() {
    if (header != nullptr) ::munmap(header, fileBytes(capacity));
  }

  Record* records() const { return reinterpret_cast<Record*>(header + 1); }

  FileDescriptor file;
  Header* header = nullptr;
  std::uint32_t capacity = 0;
  std::mutex mutex;  // Held while a counter is added, with the file's lock.
};

namespace {

bool isUTF8(std::string_view text) {
  return ostrel::wire::isUTF8(
      {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
}

template <std::size_t size>
bool fits(std::string_view text, const char (&)[size]) {
  return text.size() < size && isUTF8(text);
}

std::string_view textOf(const char* text) {
  return text != nullptr ? std::string_view(text) : std::string_view();
}

// Maps the file if it is a whole channel file of this user; 0, or the error:
// EACCES for another's, EBADMSG for what is no channel file.
int attach(FileDescriptor file, ostrel_channels& channels) {
  struct stat status {};
  if (::fstat(file.get(), &status) != 0) return errno;
  if (!S_ISREG(status.st_mode)) return EBADMSG;
  if (status.st_uid != ::geteuid() || (status.st_mode & 022) != 0) return EACCES;
  Header header{};
  if (::pread(file.get(), &header, sizeof header, 0) !=
      static_cast<ssize_t>(sizeof header)) {
    return EBADMSG;
  }
  const auto size = static_cast<std::size_t>(status.st_size);
  if (std::memcmp(header.magic, ostrel::channels::kMagic, sizeof header.magic) != 0 ||
      header.version != ostrel::channels::kVersion ||
      header.capacity > ostrel::channels::kMostCounters ||
      header.count > header.capacity || size < fileBytes(header.capacity)) {
    return EBADMSG;
  }
  void* at = ::mmap(nullptr, fileBytes(header.capacity), PROT_READ | PROT_WRITE,
                    MAP_SHARED, file.get(), 0);
  if (at == MAP_FAILED) return errno;
  channels.header = static_cast<Header*>(at);
  channels.capacity = header.capacity;
  channels.file = std::move(file);
  return 0;
}

// A new channel file under the name `path`, which becomes one that stands for no
// group; 0, or the error.
int makeFile(std::string& path, std::string_view group, std::string_view subgroup,
             std::uint32_t capacity, FileDescriptor& file) {
  file.reset(::mkostemp(path.data(), O_CLOEXEC));
  if (!file) return errno;
  ::fchmod(file.get(), 0644);  // Whatever the umask: the service must read it.
  const auto size = static_cast<off_t>(fileBytes(capacity));
  if (const int error = ::posix_fallocate(file.get(), 0, size)) return error;
  Header header{};
  std::memcpy(header.magic, ostrel::channels::kMagic, sizeof header.magic);
  header.version = ostrel::channels::kVersion;
  header.capacity = capacity;
  group.copy(header.group, sizeof header.group - 1);
  subgroup.copy(header.subgroup, sizeof header.subgroup - 1);
  const ssize_t written = ::pwrite(file.get(), &header, sizeof header, 0);
  if (written < 0) return errno;
  return written == static_cast<ssize_t>(sizeof header) ? 0 : EIO;
}

int openIn(const std::string& directory, std::string_view group,
           std::string_view subgroup, std::uint32_t capacity, ostrel_channels& channels) {
  std::error_code ignored;
  std::filesystem::create_directories(directory, ignored);
  const std::string path = directory + "/" + ostrel::channels::fileName(group, subgroup);
  // Somebody else may make or remove the file in between, a few times.
  for (int attempt = 0; attempt < 8; ++attempt) {
    FileDescriptor file(
        ::open(path.c_str(), O_RDWR | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
    if (file) {
      const int error = attach(std::move(file), channels);
      if (error != EBADMSG) return error;
      if (::unlink(path.c_str()) != 0 && errno != ENOENT) return errno;
    } else if (errno == ELOOP) {
      if (::unlink(path.c_str()) != 0 && errno != ENOENT) return errno;
    } else if (errno != ENOENT) {
      return errno;
    }
    std::string temporary = directory + "/new-XXXXXX";
    int error = makeFile(temporary, group, subgroup, capacity, file);
    if (error == 0 && ::link(temporary.c_str(), path.c_str()) != 0) error = errno;
    if (file) ::unlink(temporary.c_str());
    if (error == 0) return attach(std::move(file), channels);
    if (error != EEXIST) return error;
  }
  return EAGAIN;
}

// Of the service that this process reports to, whose runtime directory need not be
// that of this process's user.
std::string systemDirectory() {
  const char* runtime = std::getenv("RUNTIME_DIRECTORY");
  const char* socket = std::getenv("OSTREL_REPORTING_SOCKET");
  if ((runtime == nullptr || *runtime == '\0') && socket != nullptr) {
    const std::filesystem::path path(socket);
    if (path.is_absolute()) return path.parent_path() / "channels";
  }
  return ostrel::runtimeDirectory() + "/channels";
}

// The counter's record, or one past those in use.
Record* find(const ostrel_channels& channels, std::string_view name) {
  const std::uint32_t count =
      std::atomic_ref(channels.header->count).load(std::memory_order_acquire);
  Record* record = channels.records();
  Record* const end = record + std::min(count, channels.capacity);
  while (record != end &&
         std::string_view(record->name, ::strnlen(record->name, sizeof record->name)) !=
             name) {
    ++record;
  }
  return record;
}

ostrel_counter* counterOf(Record* record) {
  return reinterpret_cast<ostrel_counter*>(&record->value);
}

}  // namespace

int ostrel_channels_open_in(const char* directory, const char* group,
                            const char* subgroup, uint32_t capacity,
                            ostrel_channels** channels) {
  if (directory == nullptr || channels == nullptr) return EINVAL;
  if (!fits(textOf(group), Header().group) ||
      !fits(textOf(subgroup), Header().subgroup) ||
      capacity > OSTREL_CHANNELS_MOST_COUNTERS) {
    return EINVAL;
  }
  if (capacity == 0) capacity = OSTREL_CHANNELS_DEFAULT_COUNTERS;
  try {
    auto opened = std::make_unique<ostrel_channels>();
    const int error =
        openIn(directory, textOf(group), textOf(subgroup), capacity, *opened);
    if (error == 0) *channels = opened.release();
    return error;
  } catch (const std::bad_alloc&) {
    return ENOMEM;
  }
}

int ostrel_channels_open(const char* group, const char* subgroup, uint32_t capacity,
                         ostrel_channels** channels) {
  try {
    return ostrel_channels_open_in(systemDirectory().c_str(), group, subgroup, capacity,
                                   channels);
  } catch (const std::bad_alloc&) {
    return ENOMEM;
  }
}

int ostrel_channels_counter(ostrel_channels* channels, const char* name,
                            ostrel_counter** counter) {
  const std::string_view text = textOf(name);
  if (channels == nullptr || counter == nullptr || text.empty() ||
      !fits(text, Record().name)) {
    return EINVAL;
  }
  const std::lock_guard lock(channels->mutex);
  while (::flock(channels->file.get(), LOCK_EX) != 0) {
    if (errno != EINTR) return errno;
  }
  int error = 0;
  Header& header = *channels->header;
  Record* const record = find(*channels, text);
  const auto index = static_cast<std::uint32_t>(record - channels->records());
  if (index == channels->capacity) {
    error = ENOSPC;
  } else {
    if (index == std::atomic_ref(header.count).load(std::memory_order_relaxed)) {
      std::memset(record->name, 0, sizeof record->name);
      text.copy(record->name, sizeof record->name - 1);
      std::atomic_ref(header.count).store(index + 1, std::memory_order_release);
    }
    *counter = counterOf(record);
  }
  ::flock(channels->file.get(), LOCK_UN);
  return error;
}

void ostrel_channels_add(ostrel_counter* counter, int64_t amount) {
  std::atomic_ref(counter->value).fetch_add(amount, std::memory_order_relaxed);
}

void ostrel_channels_set(ostrel_counter* counter, int64_t value) {
  std::atomic_ref(counter->value).store(value, std::memory_order_relaxed);
}

int64_t ostrel_channels_get(const ostrel_counter* counter) {
  return std::atomic_ref(const_cast<ostrel_counter*>(counter)->value)
      .load(std::memory_order_relaxed);
}

void ostrel_channels_close(ostrel_channels* channels) { delete channels; }
