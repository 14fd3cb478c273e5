// A program that has traced functions itself.
#include <ldtr.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

static long traced() {
  ldtr_function_local<0x3F010100, 33, LDTR_EVENT_CLASS_33> trace(nullptr);
  if (ldtr_traces(LDTR_EVENT_CLASS_33)) trace(ldtr_entry_type(33))();
  if (ldtr_traces(LDTR_EVENT_DEBUG)) trace(LDTR_TYPE_DEBUG).debug(LDTR_LEVEL_ORDINARY, "%d\n", 1);
  return trace.SetErrorCode(7);
}

int main() {
  trcEvents = ~UINT64_C(0);
  pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
  bool works = ldtr_init() == 0 && traced() == 7 && ldtr_fun.SetErrorCode(3) == 3;
  {
    const AutoLock lock(&mutex, true);
    works = works && pthread_mutex_trylock(&mutex) != 0;
  }
  works = works && pthread_mutex_trylock(&mutex) == 0;
  const AutoFree<char> text(strdup("text"), std::free);
  works = works && std::strcmp(text.get(), "text") == 0;
  std::puts(works ? "frame client: works" : "frame client: wrong answer");
  return works ? 0 : 1;
}
