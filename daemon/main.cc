#include "daemon_lifecycle.h"

int main() { return _CorvaneLogManager::RunDaemon(); }
