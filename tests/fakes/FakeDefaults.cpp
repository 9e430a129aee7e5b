#include "tests/fakes/FakeDefaults.h"

#include <cctype>

namespace qn::testing {
namespace {

bool EqualsIgnoringCase(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) return false;
  for (std::size_t i = 0; i < a.size(); ++i) {
    if (std::tolower(static_cast<unsigned char>(a[i])) !=
        std::tolower(static_cast<unsigned char>(b[i]))) {
      return false;
    }
  }
  return true;
}

bool StartsWithNonZeroNumber(std::string_view s) {
  std::size_t i = 0;
  while (i < s.size() && std::isspace(static_cast<unsigned char>(s[i]))) ++i;
  if (i < s.size() && (s[i] == '+' || s[i] == '-')) ++i;
  for (; i < s.size() && std::isdigit(static_cast<unsigned char>(s[i])); ++i) {
    if (s[i] != '0') return true;
  }
  return false;
}

class FakeDefaultsSuite final : public DefaultsSuite {
 public:
  explicit FakeDefaultsSuite(Dictionary values) : values_(std::move(values)) {}

  std::optional<Value> ObjectForKey(const std::string& key) const override {
    if (const Value* v = values_.Find(key)) return *v;
    return std::nullopt;
  }

  std::optional<std::string> StringForKey(const std::string& key) const override {
    const Value* v = values_.Find(key);
    if (v == nullptr) return std::nullopt;
    if (const std::string* s = v->as_string()) return *s;
    if (v->is_number()) return v->Description();
    return std::nullopt;
  }

  bool BoolForKey(const std::string& key) const override {
    const Value* v = values_.Find(key);
    if (v == nullptr) return false;
    if (const bool* b = v->as_bool()) return *b;
    if (v->is_number()) return v->as_double().value_or(0) != 0;
    if (const std::string* s = v->as_string()) {
      return EqualsIgnoringCase(*s, "YES") || EqualsIgnoringCase(*s, "true") ||
             StartsWithNonZeroNumber(*s);
    }
    return false;
  }

 private:
  const Dictionary values_;
};

}  // namespace

std::unique_ptr<DefaultsSuite> FakeDefaults::OpenSuite(const std::string& suite_name) {
  std::lock_guard lock(mu_);
  opens_[suite_name]++;
  auto it = suites_.find(suite_name);
  return std::make_unique<FakeDefaultsSuite>(it == suites_.end() ? Dictionary() : it->second);
}

void FakeDefaults::Set(const std::string& suite, const std::string& key, Value value) {
  std::lock_guard lock(mu_);
  suites_[suite].Set(key, std::move(value));
}

void FakeDefaults::Remove(const std::string& suite, const std::string& key) {
  std::lock_guard lock(mu_);
  suites_[suite].Erase(key);
}

void FakeDefaults::ClearSuite(const std::string& suite) {
  std::lock_guard lock(mu_);
  suites_.erase(suite);
}

int FakeDefaults::Opens(const std::string& suite) const {
  std::lock_guard lock(mu_);
  auto it = opens_.find(suite);
  return it == opens_.end() ? 0 : it->second;
}

}  // namespace qn::testing
