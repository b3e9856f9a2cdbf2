#pragma once

#include <new>
#include <type_traits>
#include <utility>

namespace tamber {

// The one idiom for an object that must live as long as the process: built in place on first
// use and never destroyed, so that a thread still running while the process exits (a worker
// finishing a block, a late log line) never reaches a destroyed object, whatever the order in
// which statics go away. Use it only where one object per process is the contract (the log
// handle, the worker pool, the timer, the global queue, the slots a runtime installs its
// services into); everything else belongs to a ProviderRuntime, which stops and joins it.
//
//     Log& Log::shared() {
//         static ProcessWide<Log> log;
//         return *log;
//     }
//
// Unlike `static T* p = new T`, nothing is allocated, so leak checkers see no leak either.
template <class T>
class ProcessWide {
public:
    template <class... Args>
    explicit ProcessWide(Args&&... args) {
        new (storage_) T(std::forward<Args>(args)...);
    }
    ~ProcessWide() = default;  // deliberately leaves the object alive
    ProcessWide(const ProcessWide&) = delete;
    ProcessWide& operator=(const ProcessWide&) = delete;

    T* get() { return std::launder(reinterpret_cast<T*>(storage_)); }
    T& operator*() { return *get(); }
    T* operator->() { return get(); }

private:
    alignas(T) unsigned char storage_[sizeof(T)];
};

}  // namespace tamber
