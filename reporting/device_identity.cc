#include "reporting/device_identity.h"

#include <stdlib.h>
#include <string.h>
#include <system_info.h>
#include <telephony.h>

#include <new>

namespace _CorvaneLogManager {

namespace {

// 0 and |*out| set when the platform gives the text; -1 and |*out| left alone otherwise.
int ReadSystemText(system_info_key_e key, DeviceIdentity::PlatformText* out) {
  char* text = nullptr;
  if (system_info_get_value_string(key, &text) != 0) return -1;
  out->reset(text);
  return 0;
}

}  // namespace

int DeviceIdentity::Refresh() {
  mcc.reset();
  mnc.reset();
  int result = ReadOperator();
  if (model == nullptr) result = ReadSystemText(SYSTEM_INFO_KEY_MODEL, &model);
  if (firmware == nullptr) result = ReadSystemText(SYSTEM_INFO_KEY_BUILD_STRING, &firmware);
  return result;
}

int DeviceIdentity::ReadOperator() {
  telephony_handle_list_s list;
  memset(&list, 0, sizeof(list));
  if (telephony_init(&list) != 0) return -1;
  char* text = nullptr;
  int err = list.count == 0 ? -1 : telephony_sim_get_operator(list.handle[0], &text);
  PlatformText op(text);
  size_t len = op != nullptr ? strlen(op.get()) : 0;
  if (err != 0 || (len != 5 && len != 6)) {
    (void)telephony_deinit(&list);
    return -1;
  }
  size_t mncLen = len - 3;
  mcc.reset(new (std::nothrow) char[4]);
  mnc.reset(new (std::nothrow) char[mncLen + 1]);
  if (mcc != nullptr && mnc != nullptr) {
    memcpy(mcc.get(), op.get(), 3);
    mcc[3] = '\0';
    memcpy(mnc.get(), op.get() + 3, mncLen);
    mnc[mncLen] = '\0';
  } else {
    // The codes are then simply unknown; the read itself counts as done.
    mcc.reset();
    mnc.reset();
  }
  (void)telephony_deinit(&list);
  return 0;
}

}  // namespace _CorvaneLogManager
