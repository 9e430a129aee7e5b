// A driver counter file (<root>/<group>/<subgroup>/<channel>): any bytes sample as a number
// or not at all, never harm.
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <string_view>

#include "platform/linux/linux_ostrel.h"
#include "tests/fuzz/FuzzInput.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string root = qn::fuzz::Folder() + "/counters";
  std::filesystem::create_directories(root + "/group/subgroup");
  qn::fuzz::WriteInput(root + "/group/subgroup/channel",
                       {reinterpret_cast<const char*>(data), size});
  auto ostrel = qn::NewLinuxOstrel(root);
  std::optional<qn::OstrelError> error;
  auto channels = ostrel->CopyChannelsInGroup(std::nullopt, std::nullopt, 0, &error);
  if (!channels) return 0;
  qn::Dictionary subscribed;
  auto subscription = ostrel->CreateSubscription(*channels, &subscribed);
  auto samples = ostrel->CreateSamples(subscription.get(), subscribed, &error);
  if (!samples) return 0;
  ostrel->Iterate(*samples, [&](const qn::Value& sample) {
    (void)ostrel->SimpleGetIntegerValue(sample, 0);
    return 0;
  });
  (void)ostrel->CreateSamplesDelta(&*samples, *samples, &error);
  return 0;
}
