#include "reporting/device_identity.h"

#include <stdlib.h>
#include <string.h>
#include <system_info.h>
#include <telephony.h>

#include <new>

namespace _CorvaneLogManager {

DeviceIdentity::~DeviceIdentity() {
  delete[] mcc;
  delete[] mnc;
  free(firmware);
  free(model);
}

int DeviceIdentity::Refresh() {
  delete[] mcc;
  delete[] mnc;
  mcc = nullptr;
  mnc = nullptr;
  int result = ReadOperator();

  if (model == nullptr) {
    result = system_info_get_value_string(SYSTEM_INFO_KEY_MODEL, &model) == 0 ? 0 : -1;
    if (result != 0) model = nullptr;
  }
  if (firmware == nullptr) {
    result = system_info_get_value_string(SYSTEM_INFO_KEY_BUILD_STRING, &firmware) == 0 ? 0 : -1;
    if (result != 0) firmware = nullptr;
  }
  return result;
}

int DeviceIdentity::ReadOperator() {
  telephony_handle_list_s list;
  memset(&list, 0, sizeof(list));
  if (telephony_init(&list) != 0) return -1;
  char* op = nullptr;
  if (list.count == 0 || telephony_sim_get_operator(list.handle[0], &op) != 0 || op == nullptr) {
    free(op);
    (void)telephony_deinit(&list);
    return -1;
  }
  size_t len = strlen(op);
  if (len != 5 && len != 6) {
    free(op);
    (void)telephony_deinit(&list);
    return -1;
  }
  size_t mncLen = len - 3;
  mcc = new (std::nothrow) char[4];
  mnc = new (std::nothrow) char[mncLen + 1];
  if (mcc != nullptr && mnc != nullptr) {
    memcpy(mcc, op, 3);
    mcc[3] = '\0';
    memcpy(mnc, op + 3, mncLen);
    mnc[mncLen] = '\0';
  } else {
    // The codes are then simply unknown; the read itself counts as done.
    delete[] mcc;
    delete[] mnc;
    mcc = nullptr;
    mnc = nullptr;
  }
  free(op);
  (void)telephony_deinit(&list);
  return 0;
}

}  // namespace _CorvaneLogManager
