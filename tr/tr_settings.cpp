/*
 * tr_settings.cpp - the settings of libqv_tr: reading QV_TRACE_LEVELS,
 * QV_TRACE_FILE and QV_TRACE_DEVELOPMENT, and the level each setting gives a
 * category.
 *
 * The environment is read once into an immutable snapshot that is published
 * with a compare-and-swap, so racing first callers agree on one snapshot and
 * readers never lock. Malformed level items are skipped one by one: a typo
 * in one item must not switch off the tracing the other items ask for.
 */
#include <atomic>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "tr_internal.h"

namespace {

constexpr unsigned kMaximumLevel = 255;

std::atomic<const tr_i_settings_t *> Current_Settings{nullptr};

std::string_view trim_blanks(std::string_view text) {
  const auto is_blank = [](char c) { return c == ' ' || c == '\t'; };
  while (!text.empty() && is_blank(text.front())) {
    text.remove_prefix(1);
  }
  while (!text.empty() && is_blank(text.back())) {
    text.remove_suffix(1);
  }
  return text;
}

/* A decimal number from 0 to 255, nothing else (no sign, no blanks inside). */
bool parse_level(std::string_view text, unsigned char *p_level) {
  if (text.empty()) {
    return false;
  }
  unsigned value = 0;
  for (char c : text) {
    if (c < '0' || c > '9') {
      return false;
    }
    value = value * 10 + static_cast<unsigned>(c - '0');
    if (value > kMaximumLevel) {
      return false;
    }
  }
  *p_level = static_cast<unsigned char>(value);
  return true;
}

/* One item "component[.category]=level"; false when it is malformed. */
bool parse_item(std::string_view item, tr_i_level_setting_t *p_setting) {
  const std::size_t equals = item.find('=');
  if (equals == std::string_view::npos) {
    return false;
  }
  if (!parse_level(trim_blanks(item.substr(equals + 1)), &p_setting->level)) {
    return false;
  }
  const std::string_view name = trim_blanks(item.substr(0, equals));
  const std::size_t dot = name.find('.');
  const std::string_view component = trim_blanks(name.substr(0, dot));
  if (component.empty()) {
    return false;
  }
  p_setting->component.assign(component);
  p_setting->applies_to_every_category = true;
  p_setting->category.clear();
  if (dot != std::string_view::npos) {
    const std::string_view category = trim_blanks(name.substr(dot + 1));
    if (category.empty()) {
      return false;
    }
    if (category != "*") {
      p_setting->applies_to_every_category = false;
      p_setting->category.assign(category);
    }
  }
  return true;
}

std::unique_ptr<tr_i_settings_t> read_environment() {
  auto p_settings = std::make_unique<tr_i_settings_t>();
  if (const char *p_levels = std::getenv("QV_TRACE_LEVELS")) {
    p_settings->level_settings = tr_i_parse_level_settings(p_levels);
  }
  if (const char *p_file = std::getenv("QV_TRACE_FILE")) {
    p_settings->trace_file_path = p_file;
  }
  const char *p_development = std::getenv("QV_TRACE_DEVELOPMENT");
  p_settings->keep_development_records =
      p_development != nullptr && std::strcmp(p_development, "1") == 0;
  p_settings->p_previous = nullptr;
  return p_settings;
}

}  // namespace

std::vector<tr_i_level_setting_t> tr_i_parse_level_settings(std::string_view text) {
  std::vector<tr_i_level_setting_t> level_settings;
  std::size_t start = 0;
  while (start <= text.size()) {
    std::size_t comma = text.find(',', start);
    if (comma == std::string_view::npos) {
      comma = text.size();
    }
    tr_i_level_setting_t setting;
    if (parse_item(trim_blanks(text.substr(start, comma - start)), &setting)) {
      level_settings.push_back(std::move(setting));
    }
    start = comma + 1;
  }
  return level_settings;
}

unsigned char tr_i_level_for(const std::vector<tr_i_level_setting_t> &level_settings,
                             const char *p_component, const char *p_category) {
  unsigned char level = 0;
  for (const tr_i_level_setting_t &setting : level_settings) {
    if (setting.component != "*" && setting.component != p_component) {
      continue;
    }
    if (!setting.applies_to_every_category &&
        (p_category == nullptr || setting.category != p_category)) {
      continue;
    }
    level = setting.level;
  }
  return level;
}

const tr_i_settings_t &tr_i_current_settings() {
  const tr_i_settings_t *p_current = Current_Settings.load(std::memory_order_acquire);
  if (p_current != nullptr) {
    return *p_current;
  }
  std::unique_ptr<tr_i_settings_t> p_read = read_environment();
  if (Current_Settings.compare_exchange_strong(p_current, p_read.get(), std::memory_order_acq_rel,
                                               std::memory_order_acquire)) {
    return *p_read.release();
  }
  return *p_current;
}

void tr_i_reload_settings() {
  std::unique_ptr<tr_i_settings_t> p_read = read_environment();
  const tr_i_settings_t *p_current = Current_Settings.load(std::memory_order_acquire);
  do {
    p_read->p_previous = p_current;
  } while (!Current_Settings.compare_exchange_weak(
      p_current, p_read.get(), std::memory_order_acq_rel, std::memory_order_acquire));
  const tr_i_settings_t &settings = *p_read.release();
  tr_i_close_trace_file();
  tr_i_apply_levels_to_registered_components(settings);
}
