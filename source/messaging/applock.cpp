#include "nxbase/applock.h"

#include "messaging_log.h"
#include "nxbase/logfile.h"
#include "nxbase/postoffice.h"

namespace {

void LockLog(const char* asText) {
    if (nxbase::detail::ApplicationLockLogged()) {
        LogFile::WriteToLog(String(asText), String("ApplicationLock"));
    }
}

}  // namespace

ApplicationLockHolder::ApplicationLockHolder(std::string_view asName) {
    // The scoped entry exists only while its key is on: the handler takes a
    // holder for every command.
    if (nxbase::detail::ApplicationLockLogged()) {
        pmLog = std::make_shared<AutoLog>(String("ApplicationLockHolder ") + String(asName),
                                          String("ApplicationLock"));
    }
}

ApplicationLockHolder::~ApplicationLockHolder() {
    if (amLocked && PostOffice::IsInitialized()) PostOffice::Instance()->UnlockApplication();
}

bool ApplicationLockHolder::Lock() {
    amLocked = PostOffice::Instance()->LockApplication() != 0;
    if (amLocked && pmLog) pmLog->Log(String("Locked"));
    return amLocked;
}

unsigned char PostOffice::LockApplication() {
    LockLog("LockApplication");
    if (amLockOwner != "0") {
        LockLog("Lock fail: String");
        return false;
    }
    if (amLocalLock == 1) {
        LockLog("Lock fail: App already locked");
        return false;
    }
    LockLog("Locked");
    amLocalLock = 1;
    return true;
}

void PostOffice::UnlockApplication() {
    LockLog("Unlocked");
    amLocalLock = 0;
}

unsigned char PostOffice::CheckLock(const String& asSender) {
    return amLockOwner == asSender || amLockOwner == "0";
}
