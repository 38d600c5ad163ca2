// NxSingleton is the base of every process-wide service. A registry of live
// singletons lets an application tear them all down, newest first, with one
// call to DeleteAllSingleton(). The registry has no lock: create and delete
// services on the main thread at start-up and shutdown.
#ifndef NXBASE_SINGLETON_H_
#define NXBASE_SINGLETON_H_

#include <deque>
#include <stdexcept>
#include <string>
#include <utility>

#include "nxbase/export.h"

class NXBASE_EXPORT NxSingleton {
  public:
    // Stores the identifier and logs "Creating singleton <id>" under "Startup".
    // Does not register the object: the creating function inserts it.
    explicit NxSingleton(const std::string& identifier);
    NxSingleton(const NxSingleton&) = default;
    NxSingleton& operator=(const NxSingleton&) = default;
    virtual ~NxSingleton();

    const std::string& GetIdentifier() const { return identifier; }

    // Puts `p` at the front of the registry.
    static void Insert(NxSingleton* p);
    // Erases the first entry equal to `p`; unknown pointers are ignored.
    static void Remove(NxSingleton* p);
    // Overwrites the first entry equal to `previous` with `successor` in place,
    // or appends `successor` at the back when `previous` is not registered.
    static void Replace(NxSingleton* previous, NxSingleton* successor);
    // Deletes every registered singleton, front (newest) first, logging
    // "Removing singleton <id>" under "Startup" for each.
    static void DeleteAllSingleton();

    // Number of registered singletons (for diagnostics and tests).
    static std::size_t RegisteredCount();
    static bool IsRegistered(const NxSingleton* p);

  private:
    std::string identifier;
    static std::deque<NxSingleton*> mListOfSingletons;
};

namespace nxbase {

// The one replacement of a service: the live instance (if another) is
// unregistered and deleted, then `successor` (may be null) is stored and,
// unless it is registered already, inserted at the front. (A constructor
// may have stored itself in `instance`.)
template <class T>
T* InstallSingleton(T*& instance, T* successor) {
    if (instance != nullptr && instance != successor) {
        T* previous = instance;
        NxSingleton::Remove(previous);
        delete previous;  // its destructor may null `instance`
    }
    instance = successor;
    if (successor != nullptr && !NxSingleton::IsRegistered(successor)) {
        NxSingleton::Insert(successor);
    }
    return successor;
}

// The create-or-replace step every service's CreateX() shares: the live
// instance goes before a new T(args...) is made (they may hold the same
// names or files).
template <class T, class... Args>
T* CreateOrReplaceSingleton(T*& instance, Args&&... args) {
    InstallSingleton<T>(instance, nullptr);
    return InstallSingleton(instance, new T(std::forward<Args>(args)...));
}

// Strict Instance(): the instance, or std::logic_error(message) when absent.
template <class T, class Error = std::logic_error>
T* StrictSingletonInstance(T* instance, const char* message) {
    if (instance == nullptr) throw Error(message);
    return instance;
}

// Lazy Instance(): creates, registers and then loads (`load` is called on the
// new object) when absent.
template <class T, class Load>
T* LazySingletonInstance(T*& instance, Load load) {
    if (instance == nullptr) load(*InstallSingleton(instance, new T()));
    return instance;
}

}  // namespace nxbase

#endif  // NXBASE_SINGLETON_H_
