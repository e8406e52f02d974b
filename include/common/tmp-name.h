// TmpNameGen: short random names for temporary files (a received file
// transfer without a destination, the file utilities' temporary paths).
//
// One process-wide generator keeps an RC4 keystream seeded once from the
// clock and turns 6 keystream bytes into 8 characters of the alphabet
// "0-9a-zA-Z-_". The randomness is for uniqueness, not for security.
// Any thread may call getTmpName and getTmpPath.
#ifndef PLOVO_COMMON_TMP_NAME_H
#define PLOVO_COMMON_TMP_NAME_H

#include <mutex>
#include <string>

class TmpNameGen {
 public:
  static TmpNameGen& getInstance();

  // A new 8-character name.
  std::string getTmpName();
  // dir + "/" + a new name; neither the folder nor the name is checked.
  std::string getTmpPath(const std::string& dir);

  // The steps of the generator, public so that they can be checked alone.
  // get_key writes "<seconds>-<microseconds>" of the time of day into the
  // n-byte key, zero-terminated, leaving the rest zero.
  static void get_key(unsigned char* buf, size_t n);
  // The RC4 key schedule over all 256 key bytes (the zeros after the text
  // take part). A key whose first byte is 0 is first filled from rand().
  static void rc4_init(unsigned char* state, unsigned char* key);
  // n keystream bytes. Both counters restart at 0 on every call; only the
  // permutation carries over, which is what makes successive calls differ.
  static void rc4_randomize(unsigned char* state, unsigned char* out, size_t n);
  // The 8 characters of 6 keystream bytes: base64's bit layout over the
  // name alphabet, without padding.
  static std::string encode_name(const unsigned char* block);

 private:
  TmpNameGen();

  static std::mutex m_lock;
  unsigned char m_state[256];
  unsigned char m_key[256];
  unsigned char m_out[6];
};

#endif
