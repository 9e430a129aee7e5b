#include "platform/linux/linux_ostrel.h"

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <charconv>
#include <filesystem>
#include <limits>
#include <vector>

#include "platform/linux/small_file.h"
#include "platform/ostrel_samples.h"

namespace qn {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t kMaxChannels = 4096;
constexpr std::size_t kMaxCounterBytes = 64;

void SetError(std::optional<OstrelError>* error, int code) {
  if (error != nullptr && !*error) *error = OstrelError{code};
}

// The sorted names of the folders (or regular files) in `dir`, skipping dot-files. A missing
// folder has none; another listing failure is stored in *error_code.
std::vector<std::string> List(const fs::path& dir, bool want_directories, int* error_code) {
  std::vector<std::string> names;
  std::error_code ec;
  fs::directory_iterator it(dir, ec);
  if (ec) {
    if (ec != std::errc::no_such_file_or_directory && ec != std::errc::not_a_directory) {
      *error_code = ec.value();
    }
    return names;
  }
  while (it != fs::directory_iterator()) {
    const std::string name = it->path().filename().string();
    if (!name.empty() && name.front() != '.') {
      std::error_code type_ec;  // symbolic links are followed, as in sysfs
      if (want_directories ? it->is_directory(type_ec) : it->is_regular_file(type_ec)) {
        names.push_back(name);
      }
    }
    if (it.increment(ec); ec) break;
  }
  if (ec) *error_code = ec.value();
  std::sort(names.begin(), names.end());
  return names;
}

// A path component this library would have listed.
bool ValidComponent(const std::string* s) {
  return s != nullptr && !s->empty() && s->front() != '.' && s->find('/') == std::string::npos &&
         s->find('\0') == std::string::npos;
}

// The counter file of a channel description entry, or nullopt when it is not one of ours.
std::optional<fs::path> ChannelFile(const fs::path& root, const Value& key, const Value& entry) {
  const Dictionary* d = entry.as_dictionary();
  if (d == nullptr) return std::nullopt;
  const Value* group = d->Find("group");
  const Value* subgroup = d->Find("subgroup");
  const Value* name = d->Find("name");
  if (group == nullptr || subgroup == nullptr || name == nullptr) return std::nullopt;
  const std::string* g = group->as_string();
  const std::string* s = subgroup->as_string();
  const std::string* n = name->as_string();
  if (!ValidComponent(g) || !ValidComponent(s) || !ValidComponent(n)) return std::nullopt;
  const std::string* k = key.as_string();
  if (k == nullptr || *k != *g + "/" + *s + "/" + *n) return std::nullopt;
  return root / *g / *s / *n;
}

// Parses a counter file's text: one integer, blanks around it allowed.
std::optional<std::int64_t> ParseCounter(std::string_view text) {
  auto blank = [](char c) { return std::isspace(static_cast<unsigned char>(c)) != 0; };
  while (!text.empty() && blank(text.front())) text.remove_prefix(1);
  while (!text.empty() && blank(text.back())) text.remove_suffix(1);
  if (text.empty()) return std::nullopt;
  const char* end = text.data() + text.size();
  std::int64_t value = 0;
  auto [p, ec] = std::from_chars(text.data(), end, value);
  if (ec == std::errc() && p == end) return value;
  if (ec == std::errc::result_out_of_range && text.front() != '-') {
    std::uint64_t u = 0;
    auto [pu, ecu] = std::from_chars(text.data(), end, u);
    if (ecu == std::errc() && pu == end) return static_cast<std::int64_t>(u);
  }
  return std::nullopt;
}

class LinuxOstrelSubscription final : public OstrelSubscription {};

class LinuxOstrel final : public Ostrel {
 public:
  explicit LinuxOstrel(std::string root) : root_(std::move(root)) {}

  std::optional<Dictionary> CopyChannelsInGroup(const std::optional<std::string>& group,
                                                const std::optional<std::string>& subgroup,
                                                std::uint64_t /*options*/,
                                                std::optional<OstrelError>* error) override {
    int list_error = 0;
    std::vector<std::string> groups;
    if (group) {
      groups.push_back(*group);
    } else {
      groups = List(root_, true, &list_error);
    }
    bool found = false;
    Dictionary channels;
    for (const std::string& g : groups) {
      if (!ValidComponent(&g)) continue;
      std::vector<std::string> subgroups;
      if (subgroup) {
        subgroups.push_back(*subgroup);
      } else {
        subgroups = List(root_ / g, true, &list_error);
      }
      for (const std::string& s : subgroups) {
        if (!ValidComponent(&s)) continue;
        std::error_code ec;
        if (!fs::is_directory(root_ / g / s, ec)) {
          if (ec && ec != std::errc::no_such_file_or_directory &&
              ec != std::errc::not_a_directory) {
            list_error = ec.value();
          }
          continue;
        }
        found = true;
        for (const std::string& name : List(root_ / g / s, false, &list_error)) {
          if (channels.size() == kMaxChannels) {
            SetError(error, E2BIG);
            return channels;
          }
          channels.Set(g + "/" + s + "/" + name,
                       Dictionary{{"group", g}, {"subgroup", s}, {"name", name}});
        }
      }
    }
    if (list_error != 0) SetError(error, list_error);
    if (!found) return std::nullopt;
    return channels;
  }

  std::int32_t GetChannelCount(const Dictionary& channels) const override {
    return static_cast<std::int32_t>(
        std::min<std::size_t>(channels.size(), std::numeric_limits<std::int32_t>::max()));
  }

  std::shared_ptr<OstrelSubscription> CreateSubscription(const Dictionary& channels,
                                                         Dictionary* subscribed) override {
    if (subscribed != nullptr) {
      Dictionary valid;
      for (const auto& [key, entry] : channels) {
        if (ChannelFile(root_, key, entry)) valid.Set(key, entry);
      }
      *subscribed = std::move(valid);
    }
    return std::make_shared<LinuxOstrelSubscription>();
  }

  std::optional<Dictionary> CreateSamples(const OstrelSubscription* subscription,
                                          const Dictionary& subscribed,
                                          std::optional<OstrelError>* error) override {
    if (subscription == nullptr) {
      SetError(error, EBADF);
      return std::nullopt;
    }
    Dictionary samples;
    for (const auto& [key, entry] : subscribed) {
      const std::optional<fs::path> file = ChannelFile(root_, key, entry);
      if (!file) {
        SetError(error, EINVAL);
        return std::nullopt;
      }
      std::string text;
      if (auto read_error = ReadSmallFile(file->string(), kMaxCounterBytes, text)) {
        SetError(error, static_cast<int>(read_error->code));
        return std::nullopt;
      }
      const std::optional<std::int64_t> value = ParseCounter(text);
      if (!value) {
        SetError(error, EBADMSG);
        return std::nullopt;
      }
      samples.Set(key,
                  Dictionary{{"name", *entry.as_dictionary()->Find("name")}, {"value", *value}});
    }
    return samples;
  }

  std::optional<Dictionary> CreateSamplesDelta(const Dictionary* earlier, const Dictionary& later,
                                               std::optional<OstrelError>* error) override {
    return OstrelSamplesDelta(earlier, later, error);
  }

  void Iterate(const Dictionary& samples,
               const std::function<int(const Value& channel_sample)>& fn) const override {
    OstrelIterateSamples(samples, fn);
  }

  std::int64_t SimpleGetIntegerValue(const Value& channel_sample, int /*options*/) const override {
    return OstrelSampleValue(channel_sample).value_or(0);
  }

  std::optional<std::string> ChannelGetChannelName(const Value& channel_sample) const override {
    return OstrelSampleName(channel_sample);
  }

 private:
  const fs::path root_;
};

}  // namespace

std::shared_ptr<Ostrel> NewLinuxOstrel(std::string root) {
  return std::make_shared<LinuxOstrel>(std::move(root));
}

}  // namespace qn
