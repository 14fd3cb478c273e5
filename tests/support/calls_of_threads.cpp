#include "calls_of_threads.h"

#include <filesystem>

namespace {

class Holder {
 public:
  Holder(pthread_rwlock_t* lock, bool alone) : lock_(lock) {
    (void)(alone ? pthread_rwlock_wrlock(lock_) : pthread_rwlock_rdlock(lock_));
  }
  ~Holder() { (void)pthread_rwlock_unlock(lock_); }
  Holder(const Holder&) = delete;
  Holder& operator=(const Holder&) = delete;

 private:
  pthread_rwlock_t* lock_;
};

}  // namespace

CallsOfThreads::Lock::Lock() {
  pthread_rwlockattr_t attributes;
  (void)pthread_rwlockattr_init(&attributes);
  (void)pthread_rwlockattr_setkind_np(&attributes, PTHREAD_RWLOCK_PREFER_WRITER_NONRECURSIVE_NP);
  (void)pthread_rwlock_init(&lock_, &attributes);
  (void)pthread_rwlockattr_destroy(&attributes);
}

CallsOfThreads::CallsOfThreads(const std::string& directory, size_t threads)
    : edited_(directory + "/edited") {
  std::filesystem::create_directory(edited_);
  prepareCalls(edited_);
  for (size_t thread = 0; thread < threads; ++thread) {
    const std::string own = directory + "/" + std::to_string(thread);
    std::filesystem::create_directory(own);
    fillCalls(own);
    workers_.push_back({own, exportedCalls(own)});
  }
}

bool CallsOfThreads::make(size_t thread, const ExportedCall& call) {
  const Holder environment(environment_.get(), call.meanwhile == Meanwhile::kNoCall);
  bool right = false;
  if (call.meanwhile == Meanwhile::kNoEdit) {
    const Holder edited_files(edited_files_.get(), false);
    right = call.body();
  } else if (call.meanwhile == Meanwhile::kNoUseOfEditedFiles) {
    const Holder edited_files(edited_files_.get(), true);
    right = call.body();
    fillEditedFiles(edited_);
  } else {
    right = call.body();
  }
  if (call.once) fillCalls(workers_[thread].directory);
  return right;
}

void CallsOfThreads::withoutCalls(const std::function<void()>& change) {
  const Holder environment(environment_.get(), true);
  change();
}
