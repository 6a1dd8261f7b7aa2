#include "platform/linux/AlsaChannels.h"

#include <algorithm>
#include <charconv>
#include <filesystem>
#include <string_view>
#include <system_error>

#include "platform/linux/SmallFile.h"

namespace ostrel {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kGroup = "Speaker";
constexpr std::string_view kSubgroup = "ALSA";

// The directories "PREFIX..." in `directory`, in order.
std::vector<fs::path> directoriesIn(const fs::path& directory, std::string_view prefix) {
  std::vector<fs::path> found;
  std::error_code error;
  for (fs::directory_iterator i(directory, error), end; !error && i != end;
       i.increment(error)) {
    // "/proc/asound" also has links to its cards by name.
    if (i->path().filename().string().rfind(prefix, 0) == 0 &&
        i->symlink_status(error).type() == fs::file_type::directory) {
      found.push_back(i->path());
    }
  }
  std::sort(found.begin(), found.end());
  return found;
}

// The number in the line "FIELD   : NUMBER"; 0 without one.
std::int64_t numberOf(std::string_view status, std::string_view field) {
  for (std::size_t at = 0; at < status.size();) {
    const std::size_t end = std::min(status.find('\n', at), status.size());
    std::string_view line = status.substr(at, end - at);
    at = end + 1;
    if (line.substr(0, field.size()) != field) continue;
    line.remove_prefix(field.size());
    const std::size_t begin = line.find_first_not_of(" \t:");
    if (begin == 0 || begin == std::string_view::npos) continue;
    std::int64_t number = 0;
    std::from_chars(line.data() + begin, line.data() + line.size(), number);
    return number;
  }
  return 0;
}

struct Stream {
  std::string statusPath;
  std::string name;  // "card0_pcm0p_sub0".
};

class AlsaSource final : public ChannelSource {
 public:
  AlsaSource(std::string root, std::vector<Stream> streams)
      : root_(std::move(root)), streams_(std::move(streams)) {}

  const std::string& identifier() const override { return root_; }

  Outcome<std::vector<ChannelValue>> read() const override {
    std::vector<ChannelValue> values;
    for (const Stream& stream : streams_) {
      auto status = readSmallFile(stream.statusPath, AlsaChannelFinder::kMostStatusBytes,
                                  FileLinks::kRefuse);
      if (!status.value) return {std::nullopt, std::move(status.error)};
      for (const std::string_view field : {"hw_ptr", "appl_ptr"}) {
        values.push_back(
            {stream.name + "_" + std::string(field), numberOf(*status.value, field)});
      }
    }
    return {std::move(values), std::nullopt};
  }

 private:
  const std::string root_;
  const std::vector<Stream> streams_;
};

std::vector<Stream> streamsBelow(const std::string& root) {
  std::vector<Stream> streams;
  for (const fs::path& card : directoriesIn(root, "card")) {
    for (const fs::path& device : directoriesIn(card, "pcm")) {
      for (const fs::path& part : directoriesIn(device, "sub")) {
        if (streams.size() == AlsaChannelFinder::kMostStreams) return streams;
        streams.push_back({part / "status", card.filename().string() + "_" +
                                                device.filename().string() + "_" +
                                                part.filename().string()});
      }
    }
  }
  return streams;
}

}  // namespace

ChannelFinder::Found AlsaChannelFinder::find(
    const std::optional<std::string>& group,
    const std::optional<std::string>& subgroup) const {
  if (group.value_or(std::string(kGroup)) != kGroup ||
      subgroup.value_or(std::string(kSubgroup)) != kSubgroup) {
    return {};
  }
  std::vector<Stream> streams = streamsBelow(root_);
  if (streams.empty()) return {};
  return {{std::make_shared<AlsaSource>(root_, std::move(streams))}, std::nullopt};
}

}  // namespace ostrel
