// The defaults suite file: any bytes read as a dictionary or as an error, never harm.
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <string_view>

#include "platform/linux/linux_defaults.h"
#include "tests/fuzz/FuzzInput.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string& dir = qn::fuzz::Folder();
  const std::string suite = "com.norvel.quenta";
  const std::string path = qn::DefaultsSuitePath(dir, suite);
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  qn::fuzz::WriteInput(path, {reinterpret_cast<const char*>(data), size});
  qn::Dictionary values;
  const bool read = !qn::ReadSuite(dir, suite, values);
  qn::fuzz::Check(read || values.empty());
  auto opened = qn::NewLinuxDefaults({.state_dir = dir})->OpenSuite(suite);
  (void)opened->BoolForKey("disable_reporting");
  (void)opened->StringForKey("disable_reporting");
  return 0;
}
