// cu_catalog.cpp - finds message texts in message catalogs (catopen/catgets).
//
// A catalog is looked up by the C library through NLSPATH and the locale's
// LC_MESSAGES, then in the directory where this library installs its
// catalogs. Opening a catalog costs a file open and a map, and errors such as
// "key not found" can be frequent, so each catalog is opened once per name
// and NLSPATH value and kept open for the life of the process; a catalog that
// cannot be found is remembered too, so that a missing catalog costs one
// lookup and not one per error.

#include <nl_types.h>

#include <cstdlib>
#include <map>
#include <mutex>
#include <string>

#include "cu_i_message.h"

namespace {

const nl_catd No_Catalog = reinterpret_cast<nl_catd>(-1);

std::mutex Catalogs_Mutex;
std::map<std::string, nl_catd> *P_Open_Catalogs;  // never freed: texts handed out point into it

nl_catd open_catalog(const std::string &name) {
  nl_catd catalog = catopen(name.c_str(), NL_CAT_LOCALE);
  if (catalog == No_Catalog && name.find('/') == std::string::npos) {
    const std::string installed = std::string(CU_CATALOG_DIRECTORY) + "/" + name;
    catalog = catopen(installed.c_str(), NL_CAT_LOCALE);
  }
  return catalog;
}

}  // namespace

const char *cu_i_catalog_text(const char *p_catalog, int32_t set, int32_t message) {
  if (p_catalog == nullptr || *p_catalog == '\0' || set <= 0 || message <= 0) {
    return nullptr;
  }
  const char *search_path = std::getenv("NLSPATH");
  std::string key = p_catalog;
  key += '\0';
  key += search_path ? search_path : "";

  nl_catd catalog;
  {
    std::lock_guard guard(Catalogs_Mutex);
    if (P_Open_Catalogs == nullptr) {
      P_Open_Catalogs = new std::map<std::string, nl_catd>;
    }
    auto found = P_Open_Catalogs->find(key);
    if (found == P_Open_Catalogs->end()) {
      found = P_Open_Catalogs->emplace(key, open_catalog(p_catalog)).first;
    }
    catalog = found->second;
  }
  if (catalog == No_Catalog) {
    return nullptr;
  }
  return catgets(catalog, set, message, nullptr);
}
