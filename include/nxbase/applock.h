// ApplicationLockHolder takes the post office's local application lock for
// the lifetime of a scope: while it is held, commands of peers other than a
// lock owner wait in the queue.
#ifndef NXBASE_APPLOCK_H_
#define NXBASE_APPLOCK_H_

#include <memory>
#include <string_view>

#include "nxbase/export.h"

class AutoLog;

class NXBASE_EXPORT ApplicationLockHolder {
  public:
    // Opens the scoped log entry "ApplicationLockHolder <name>" under
    // "ApplicationLock"; does not lock.
    explicit ApplicationLockHolder(std::string_view asName);
    // Releases the lock if this holder took it.
    ~ApplicationLockHolder();
    ApplicationLockHolder(const ApplicationLockHolder&) = delete;
    ApplicationLockHolder& operator=(const ApplicationLockHolder&) = delete;

    // Asks the post office for the lock; true when it was taken. The lock
    // does not nest: a second holder fails while the first lives.
    bool Lock();
    bool IsLocked() const { return amLocked; }

  private:
    bool amLocked = false;
    std::shared_ptr<AutoLog> pmLog;
};

#endif  // NXBASE_APPLOCK_H_
