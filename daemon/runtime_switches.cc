#include <vconf.h>

#include "include/log_manager.h"

namespace _CorvaneLogManager {

namespace {
bool g_switches[2] = {false, false};
}  // namespace

bool GetRuntimeSwitch(unsigned index) { return index <= 1 ? g_switches[index] : false; }

void SetRuntimeSwitch(unsigned index, bool on) {
  if (index <= 1) g_switches[index] = on;
}

// Key-node setters for the two switches. Deliberately registered nowhere: the switches are
// turned on by initialisation only.
void OnRuntimeSwitch0Changed(keynode_t* node, void*) {
  if (node != nullptr) g_switches[0] = vconf_keynode_get_bool(node) == 1;
}

void OnRuntimeSwitch1Changed(keynode_t* node, void*) {
  if (node != nullptr) g_switches[1] = vconf_keynode_get_bool(node) == 1;
}

}  // namespace _CorvaneLogManager
