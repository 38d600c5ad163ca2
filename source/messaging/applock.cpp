#include "nxbase/applock.h"

#include "nxbase/logfile.h"
#include "nxbase/postoffice.h"

ApplicationLockHolder::ApplicationLockHolder(const std::string& asName)
    : amName(asName),
      pmLog(std::make_shared<AutoLog>(String("ApplicationLockHolder ") + String(asName),
                                      String("ApplicationLock"))) {}

ApplicationLockHolder::~ApplicationLockHolder() {
    if (amLocked && PostOffice::IsInitialized()) PostOffice::Instance()->UnlockApplication();
}

bool ApplicationLockHolder::Lock() {
    amLocked = PostOffice::Instance()->LockApplication() != 0;
    if (amLocked) pmLog->Log(String("Locked"));
    return amLocked;
}

unsigned char PostOffice::LockApplication() {
    LogFile::WriteToLog(String("LockApplication"), String("ApplicationLock"));
    if (amLockOwner != "0") {
        LogFile::WriteToLog(String("Lock fail: String"), String("ApplicationLock"));
        return false;
    }
    if (amLocalLock == 1) {
        LogFile::WriteToLog(String("Lock fail: App already locked"), String("ApplicationLock"));
        return false;
    }
    LogFile::WriteToLog(String("Locked"), String("ApplicationLock"));
    amLocalLock = 1;
    return true;
}

void PostOffice::UnlockApplication() {
    LogFile::WriteToLog(String("Unlocked"), String("ApplicationLock"));
    amLocalLock = 0;
}

unsigned char PostOffice::CheckLock(const String& asSender) {
    return amLockOwner == asSender || amLockOwner == "0";
}
