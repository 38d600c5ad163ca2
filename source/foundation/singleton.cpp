#include "nxbase/singleton.h"

#include <algorithm>

#include "nxbase/logfile.h"

std::deque<NxSingleton*> NxSingleton::mListOfSingletons;

NxSingleton::NxSingleton(const std::string& id) : identifier(id) {
    LogFile::Instance()->WriteLog(String("Creating singleton ") + String(identifier),
                                  String("Startup"));
}

NxSingleton::~NxSingleton() = default;

void NxSingleton::Insert(NxSingleton* p) {
    mListOfSingletons.push_front(p);
}

void NxSingleton::Remove(NxSingleton* p) {
    auto at = std::find(mListOfSingletons.begin(), mListOfSingletons.end(), p);
    if (at != mListOfSingletons.end()) mListOfSingletons.erase(at);
}

void NxSingleton::Replace(NxSingleton* previous, NxSingleton* successor) {
    auto at = std::find(mListOfSingletons.begin(), mListOfSingletons.end(), previous);
    if (at != mListOfSingletons.end()) {
        *at = successor;
    } else {
        mListOfSingletons.push_back(successor);
    }
}

void NxSingleton::DeleteAllSingleton() {
    while (!mListOfSingletons.empty()) {
        NxSingleton* front = mListOfSingletons.front();
        if (front != nullptr) {
            LogFile::Instance()->WriteLog(String("Removing singleton ") + String(front->identifier),
                                          String("Startup"));
        }
        // Pop before deleting: a destructor may itself touch the registry.
        mListOfSingletons.pop_front();
        delete front;
    }
}

std::size_t NxSingleton::RegisteredCount() {
    return mListOfSingletons.size();
}

bool NxSingleton::IsRegistered(const NxSingleton* p) {
    return std::find(mListOfSingletons.begin(), mListOfSingletons.end(), p) !=
           mListOfSingletons.end();
}
