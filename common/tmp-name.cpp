#include "common/tmp-name.h"

#include <sys/time.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <utility>

namespace {

const char kAlphabet[] = "0123456789abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ-_";
static_assert(sizeof(kAlphabet) == 65, "64 name characters");

void Encode3(const unsigned char* b, char* c) {
  c[0] = kAlphabet[b[0] >> 2];
  c[1] = kAlphabet[((b[0] & 3) << 4) | (b[1] >> 4)];
  c[2] = kAlphabet[((b[1] & 15) << 2) | (b[2] >> 6)];
  c[3] = kAlphabet[b[2] & 63];
}

}  // namespace

std::mutex TmpNameGen::m_lock;

TmpNameGen& TmpNameGen::getInstance() {
  static TmpNameGen instance;
  return instance;
}

TmpNameGen::TmpNameGen() {
  get_key(m_key, sizeof(m_key));
  rc4_init(m_state, m_key);
  memset(m_out, 0, sizeof(m_out));
}

void TmpNameGen::get_key(unsigned char* buf, size_t n) {
  memset(buf, 0, n);
  timeval now{};
  gettimeofday(&now, nullptr);
  snprintf(reinterpret_cast<char*>(buf), n, "%lu-%lu", static_cast<unsigned long>(now.tv_sec),
           static_cast<unsigned long>(now.tv_usec));
}

void TmpNameGen::rc4_init(unsigned char* state, unsigned char* key) {
  for (int i = 0; i < 256; ++i) state[i] = static_cast<unsigned char>(i);
  if (key[0] == 0) {
    srand(static_cast<unsigned>(time(nullptr)));
    for (int i = 0; i < 256; ++i) key[i] = static_cast<unsigned char>(rand());
  }
  unsigned j = 0;
  for (int i = 0; i < 256; ++i) {
    j = (j + key[i] + state[i]) & 0xFF;
    std::swap(state[i], state[j]);
  }
}

void TmpNameGen::rc4_randomize(unsigned char* state, unsigned char* out, size_t n) {
  unsigned j = 0;
  for (size_t k = 0; k < n; ++k) {
    unsigned i = (k + 1) & 0xFF;
    j = (j + state[i]) & 0xFF;
    std::swap(state[i], state[j]);
    out[k] = state[(state[i] + state[j]) & 0xFF];
  }
}

std::string TmpNameGen::getTmpName() {
  std::lock_guard<std::mutex> lock(m_lock);
  rc4_randomize(m_state, m_out, sizeof(m_out));
  return encode_name(m_out);
}

std::string TmpNameGen::encode_name(const unsigned char* block) {
  char name[8];
  Encode3(block, name);
  Encode3(block + 3, name + 4);
  return std::string(name, sizeof(name));
}

std::string TmpNameGen::getTmpPath(const std::string& dir) { return dir + "/" + getTmpName(); }
