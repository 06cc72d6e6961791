// The text-preference store: [section] key=value pairs from an INI file
// (Boost.PropertyTree's INI reader) and from control::SetPreference. Values
// stay text until read; a read parses the whole value (surrounding spaces
// allowed) and falls back to the default when the key is missing.
#include <boost/algorithm/string/trim.hpp>
#include <boost/lexical_cast/try_lexical_convert.hpp>
#include <boost/property_tree/ini_parser.hpp>
#include <boost/property_tree/ptree.hpp>
#include <cmath>
#include <cstdlib>
#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "host/control.h"
#include "host/hk.h"
#include "internal.h"

namespace {

using Sections = std::map<std::string, std::map<std::string, std::string>>;

struct PrefStore {
  std::mutex mutex;
  Sections values;  // guarded by mutex
};

// Reads an INI file into sections. Keys before the first section header
// belong to the section "".
bool ReadIniFile(const std::string& path, Sections& out) {
  boost::property_tree::ptree tree;
  try {
    boost::property_tree::ini_parser::read_ini(path, tree);
  } catch (const boost::property_tree::ptree_error&) {
    return false;
  }
  Sections read;
  for (const auto& [name, node] : tree) {
    if (node.empty()) {
      read[""][name] = node.data();
    } else {
      for (const auto& [key, value] : node) read[name][key] = value.data();
    }
  }
  out.swap(read);
  return true;
}

PrefStore& Store() {
  static PrefStore* store = [] {
    auto* created = new PrefStore;  // never destroyed: read during exit as well
    if (const char* path = std::getenv("RKHOST_PREFERENCES"); path != nullptr && *path != '\0') {
      if (!ReadIniFile(path, created->values)) {
        rkhost::detail::WriteLogLine(rkhost::detail::kLevelInternal, "HK", "Preferences",
                                     std::string("cannot read preferences from ") + path);
      }
    }
    return created;
  }();
  return *store;
}

// The stored text of section/key, or nothing.
std::optional<std::string> Find(const char* section, const char* key) {
  PrefStore& store = Store();
  std::lock_guard<std::mutex> lock(store.mutex);
  auto s = store.values.find(section);
  if (s == store.values.end()) return std::nullopt;
  auto k = s->second.find(key);
  if (k == s->second.end()) return std::nullopt;
  return k->second;
}

// The common frame of the typed reads: *value gets the default first, so
// every failure leaves it there.
template <class T, class Parse>
int ReadPref(ST_PrefHandle handle, const char* section, const char* key, T defaultValue, T* value,
             Parse parse) {
  if (value == nullptr) return HK_ErrBadParameter;
  *value = defaultValue;
  if (handle == nullptr || handle != static_cast<ST_PrefHandle>(&Store())) return ST_ErrBadHandle;
  if (section == nullptr || key == nullptr) return HK_ErrBadParameter;
  const std::optional<std::string> text = Find(section, key);
  if (!text) return 0;
  T parsed{};
  if (!parse(boost::algorithm::trim_copy(*text), parsed)) return ST_ErrBadValue;
  *value = parsed;
  return 0;
}

}  // namespace

ST_PrefHandle ST_GetPrefHandle(int type) {
  return type == 0 ? static_cast<ST_PrefHandle>(&Store()) : nullptr;
}

int ST_GetTextPrefLong(ST_PrefHandle handle, const char* section, const char* key, std::int32_t defaultValue,
                       std::int32_t* value) {
  return ReadPref(handle, section, key, defaultValue, value, [](const std::string& text, std::int32_t& out) {
    return boost::conversion::try_lexical_convert(text, out);
  });
}

int ST_GetTextPrefFpLong(ST_PrefHandle handle, const char* section, const char* key, double defaultValue,
                         double* value) {
  return ReadPref(handle, section, key, defaultValue, value, [](const std::string& text, double& out) {
    return boost::conversion::try_lexical_convert(text, out) && std::isfinite(out);
  });
}

namespace rkhost {
namespace control {

bool LoadPreferencesFile(const std::string& path) {
  Sections read;
  if (!ReadIniFile(path, read)) return false;
  PrefStore& store = Store();
  std::lock_guard<std::mutex> lock(store.mutex);
  store.values.swap(read);
  return true;
}

void SetPreference(const std::string& section, const std::string& key, const std::string& value) {
  PrefStore& store = Store();
  std::lock_guard<std::mutex> lock(store.mutex);
  store.values[section][key] = value;
}

void ClearPreferences() {
  PrefStore& store = Store();
  std::lock_guard<std::mutex> lock(store.mutex);
  store.values.clear();
}

}  // namespace control
}  // namespace rkhost
