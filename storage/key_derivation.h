// The per-device database key: derived once through PBKDF2-HMAC-SHA1 and kept in a password
// file that every later start reads back.
#ifndef LOGMGR_STORAGE_KEY_DERIVATION_H_
#define LOGMGR_STORAGE_KEY_DERIVATION_H_

#include <string>

namespace _CorvaneLogManager {

struct KeyParams {
  int keyLength;   // bytes of derived key
  int iterations;  // PBKDF2 rounds
};

// Made on first need; null when the password file could neither be read nor made.
KeyParams* GetKeyParams();
// Frees the parameters; the daemon never calls it.
void ReleaseKeyParams();

// 0 when the password file holds a non-empty first line or was written; -1 otherwise.
int PreparePasswordFile(KeyParams* params);
// keyLength + 1 bytes from new[] (the last one 0), or null.
unsigned char* DeriveKey(KeyParams* params);
// The password file's first line (its newline included, cut at a zero byte), or empty.
std::string ReadKey();

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_STORAGE_KEY_DERIVATION_H_
