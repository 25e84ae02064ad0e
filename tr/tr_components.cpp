/*
 * tr_components.cpp - the registrations of components: writing each
 * category's level into the component's level array, and remembering the
 * registration so that reloaded settings reach it and records can tell a
 * registered component from an unknown one.
 *
 * The component reads its levels without a lock from any thread, so every
 * level is written with a relaxed atomic byte store. Registrations form an
 * append-only list published with compare-and-swap: registering is rare and
 * may race with itself, and a record only has to walk the list, never lock.
 */
#include <atomic>
#include <cstring>
#include <memory>

#include "tr_internal.h"

namespace {

/* One distinct registration; immutable once published. */
typedef struct tr_i_registration_struct_t {
  std::string component;
  unsigned char *p_levels;
  const tr_category_t *p_categories;
  uint32_t total_categories;
  const struct tr_i_registration_struct_t *p_next;
} tr_i_registration_t;

std::atomic<const tr_i_registration_t *> Registrations{nullptr};

void write_levels(const tr_i_settings_t &settings, const char *p_component, unsigned char *p_levels,
                  const tr_category_t *p_categories, uint32_t total_categories) {
  for (uint32_t index = 0; index < total_categories; ++index) {
    const tr_category_t &category = p_categories[index];
    const unsigned char level =
        tr_i_level_for(settings.level_settings, p_component, category.p_name);
    __atomic_store_n(&p_levels[category.category_id], level, __ATOMIC_RELAXED);
  }
}

bool is_same_registration(const tr_i_registration_t &registration, const char *p_component,
                          const unsigned char *p_levels, const tr_category_t *p_categories,
                          uint32_t total_categories) {
  return registration.p_levels == p_levels && registration.p_categories == p_categories &&
         registration.total_categories == total_categories && registration.component == p_component;
}

/* Adds the registration unless an identical one is listed, so that a
 * component registering at every start of its own work does not grow the
 * list. Racing registrants of the same triple end up with one entry: the
 * loser of the swap finds the winner's entry on its next pass. */
void remember(const char *p_component, unsigned char *p_levels, const tr_category_t *p_categories,
              uint32_t total_categories) {
  const tr_i_registration_t *p_head = Registrations.load(std::memory_order_acquire);
  std::unique_ptr<tr_i_registration_t> p_new;
  for (;;) {
    for (const tr_i_registration_t *p = p_head; p != nullptr; p = p->p_next) {
      if (is_same_registration(*p, p_component, p_levels, p_categories, total_categories)) {
        return;
      }
    }
    if (!p_new) {
      p_new.reset(
          new tr_i_registration_t{p_component, p_levels, p_categories, total_categories, nullptr});
    }
    p_new->p_next = p_head;
    if (Registrations.compare_exchange_weak(p_head, p_new.get(), std::memory_order_release,
                                            std::memory_order_acquire)) {
      p_new.release();
      return;
    }
  }
}

}  // namespace

void tr_i_register_component(const char *p_component, unsigned char *p_levels,
                             const tr_category_t *p_categories, uint32_t total_categories) {
  write_levels(tr_i_current_settings(), p_component, p_levels, p_categories, total_categories);
  remember(p_component, p_levels, p_categories, total_categories);
}

bool tr_i_component_is_registered(const char *p_component) {
  for (const tr_i_registration_t *p = Registrations.load(std::memory_order_acquire); p != nullptr;
       p = p->p_next) {
    if (p->component == p_component) {
      return true;
    }
  }
  return false;
}

void tr_i_apply_levels_to_registered_components(const tr_i_settings_t &settings) {
  for (const tr_i_registration_t *p = Registrations.load(std::memory_order_acquire); p != nullptr;
       p = p->p_next) {
    write_levels(settings, p->component.c_str(), p->p_levels, p->p_categories, p->total_categories);
  }
}

std::size_t tr_i_total_registrations() {
  std::size_t total = 0;
  for (const tr_i_registration_t *p = Registrations.load(std::memory_order_acquire); p != nullptr;
       p = p->p_next) {
    ++total;
  }
  return total;
}
