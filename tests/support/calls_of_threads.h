// The calls of exported_calls.h, made by several threads at once as far as the headers allow it.
#pragma once

#include <pthread.h>

#include <functional>
#include <string>
#include <vector>

#include "exported_calls.h"

class CallsOfThreads {
 public:
  // Each thread works in a directory of its own below `directory`, which must be empty.
  CallsOfThreads(const std::string& directory, size_t threads);
  CallsOfThreads(const CallsOfThreads&) = delete;
  CallsOfThreads& operator=(const CallsOfThreads&) = delete;

  // The same functions in the same order for each thread. To be changed before the threads begin.
  std::vector<ExportedCall>& of(size_t thread) { return workers_[thread].calls; }
  // Makes a call of this thread and fills again what the call took. Other threads wait only as far
  // as `meanwhile` of the call demands. Returns whether the results were right.
  bool make(size_t thread, const ExportedCall& call);
  // Changes the environment while no call is being made.
  void withoutCalls(const std::function<void()>& change);

 private:
  // Lets waiting writers pass readers. Readers are not ordered by it, so that it hides no race
  // between two calls from ThreadSanitizer.
  class Lock {
   public:
    Lock();
    pthread_rwlock_t* get() { return &lock_; }

   private:
    pthread_rwlock_t lock_;
  };
  struct Worker {
    std::string directory;
    std::vector<ExportedCall> calls;
  };

  std::string edited_;  // the directory of the services and inittab files, and the install root
  std::vector<Worker> workers_;
  Lock environment_;
  Lock edited_files_;
};
