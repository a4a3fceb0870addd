// The C interface: periodic metrics tasks and the statistics dictionary their
// services fill.
#include <cmath>
#include <string_view>

#include "client/TelvaneCApi.h"
#include "platform/Json.h"

using namespace telvane;

namespace {

// The service's dictionary, made a dictionary if it is not one yet.
Dictionary* dictionaryOf(telvane_stats* stats) {
  if (!stats || !stats->dictionary) return nullptr;
  if (!stats->dictionary->isDictionary()) *stats->dictionary = Value::dictionary();
  return stats->dictionary->asDictionary();
}

bool validKey(const char* key) { return key && json::isValidUtf8(key); }

// Sets a value JSON can carry; anything else is refused and changes nothing.
bool setStat(telvane_stats* stats, const char* key, Value value) {
  if (!validKey(key)) return false;
  if (!json::write(value)) return false;
  Dictionary* dictionary = dictionaryOf(stats);
  if (!dictionary) return false;
  dictionary->set(key, std::move(value));
  return true;
}

}  // namespace

extern "C" {

bool telvane_session_register_periodic_task(telvane_session* session, uint32_t module, bool need_to_update,
                                            bool need_to_report, telvane_periodic_service service, void* user_data,
                                            telvane_destroy_callback destroy) {
  if (!session || !service) {
    if (destroy) destroy(user_data);
    return false;
  }
  bool registered = capi::cEntry(nullptr, false, [&] {
    // Every copy of the closure (the registration, a tick running it) shares the user
    // data; the last one to go releases it.
    auto data = std::make_shared<capi::CUserData>(user_data, destroy);
    destroy = nullptr;
    return session->telvane->registerPeriodicTaskForModule(
        module, need_to_update, need_to_report, [service, data](Value& dictionary) {
          telvane_stats stats{&dictionary};
          service(&stats, data->get());
        });
  });
  // Refused before the user data had an owner.
  if (destroy) destroy(user_data);
  return registered;
}

bool telvane_session_unregister_periodic_task(telvane_session* session, uint32_t module) {
  if (!session) return false;
  return capi::cEntry(nullptr, false, [&] { return session->telvane->unregisterPeriodTaskForModule(module); });
}

void telvane_session_start_log_timer(telvane_session* session, uint32_t interval_seconds,
                                     uint32_t reporting_multiplier, uint16_t category, uint16_t type) {
  if (!session) return;
  capi::cEntryVoid([&] {
    session->telvane->startLogTimerWithInterval(interval_seconds, reporting_multiplier, category, type);
  });
}

void telvane_session_stop_log_timer(telvane_session* session) {
  if (!session) return;
  capi::cEntryVoid([&] { session->telvane->stopLogTimer(); });
}

bool telvane_stats_set_json(telvane_stats* stats, const char* key, const char* value_json) {
  if (!value_json) return false;
  return capi::cEntry(nullptr, false, [&] {
    std::optional<Value> value = capi::parseJson(value_json, "the value", nullptr);
    return value && setStat(stats, key, std::move(*value));
  });
}

bool telvane_stats_set_int(telvane_stats* stats, const char* key, int64_t value) {
  return capi::cEntry(nullptr, false, [&] { return setStat(stats, key, Value(static_cast<long long>(value))); });
}

bool telvane_stats_set_double(telvane_stats* stats, const char* key, double value) {
  if (!std::isfinite(value)) return false;
  return capi::cEntry(nullptr, false, [&] { return setStat(stats, key, Value(value)); });
}

bool telvane_stats_set_bool(telvane_stats* stats, const char* key, bool value) {
  return capi::cEntry(nullptr, false, [&] { return setStat(stats, key, Value(value)); });
}

bool telvane_stats_set_string(telvane_stats* stats, const char* key, const char* value) {
  if (!value) return false;
  return capi::cEntry(nullptr, false, [&] { return setStat(stats, key, Value(std::string_view(value))); });
}

bool telvane_stats_update_json(telvane_stats* stats, const char* object_json) {
  if (!object_json) return false;
  return capi::cEntry(nullptr, false, [&] {
    std::optional<Value> object = capi::parseObject(object_json, "the statistics", false, nullptr);
    if (!object) return false;
    Dictionary* dictionary = dictionaryOf(stats);
    if (!dictionary) return false;
    for (const auto& [key, value] : *object->asDictionary()) dictionary->set(key, value);
    return true;
  });
}

}  // extern "C"
