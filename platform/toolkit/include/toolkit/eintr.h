// A system call that a signal interrupted (it failed with EINTR) is made
// again, as its documentation asks: the one retry loop of the library.
#ifndef TOOLKIT_EINTR_H_
#define TOOLKIT_EINTR_H_

#include <cerrno>

namespace toolkit {

// Calls `call` until it returns something other than -1 with errno EINTR;
// returns the last result, errno as the call left it.
template <class Call>
auto RetryOnEintr(Call call) -> decltype(call()) {
    decltype(call()) result;
    do {
        result = call();
    } while (result == -1 && errno == EINTR);
    return result;
}

}  // namespace toolkit

#endif  // TOOLKIT_EINTR_H_
