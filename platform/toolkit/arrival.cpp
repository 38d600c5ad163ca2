#include "toolkit/arrival.h"

#include <sys/epoll.h>

#include <cerrno>

namespace toolkit {

namespace {

using boost::asio::detail::epoll_reactor;
using State = epoll_reactor::descriptor_state;
using Operation = boost::asio::detail::scheduler_operation;

// asio keeps these members private. An explicit instantiation may name a
// private member; a boost that renames one fails to compile here instead of
// misbehaving.
template <class Tag, typename Tag::type Member>
struct Named {
    friend typename Tag::type MemberOf(Tag) { return Member; }
};
struct EpollDescriptor {
    using type = int epoll_reactor::*;
    friend type MemberOf(EpollDescriptor);
};
struct RegisteredEvents {
    using type = std::uint32_t State::*;
    friend type MemberOf(RegisteredEvents);
};
struct ReadyEvents {
    using type = unsigned int Operation::*;
    friend type MemberOf(ReadyEvents);
};
template struct Named<EpollDescriptor, &epoll_reactor::epoll_fd_>;
template struct Named<RegisteredEvents, &State::registered_events_>;
template struct Named<ReadyEvents, &Operation::task_result_>;

epoll_reactor& Reactor(boost::asio::io_context& axContext) {
    return boost::asio::use_service<epoll_reactor>(axContext);
}

}  // namespace

int ReactorDescriptor(boost::asio::io_context& axContext) {
    auto& reactor = Reactor(axContext);
    // The reactor runs in a poll only once it is the scheduler's task, which
    // the first timer or socket would make it; until then its first wake-up
    // would stay unread and keep the descriptor readable.
    reactor.init_task();
    return reactor.*MemberOf(EpollDescriptor{});
}

ArrivalWatch WatchPeerShutdown(LocalSocket& axSocket) {
    auto& implementation = detail::SocketAccess::Implementation(axSocket);
    State* state = implementation.reactor_data_;
    if (state == nullptr) return {};
    std::uint32_t& events = state->*MemberOf(RegisteredEvents{});
    events |= EPOLLRDHUP;  // kept by asio's own later re-arming, which passes these
    epoll_event event{};
    event.events = events;
    event.data.ptr = state;
    epoll_reactor& reactor = Reactor(axSocket.get_executor().context());
    if (::epoll_ctl(reactor.*MemberOf(EpollDescriptor{}), EPOLL_CTL_MOD, implementation.socket_,
                    &event) != 0)
        return {};
    ArrivalWatch watch;
    watch.reactor = &reactor;
    return watch;
}

namespace detail {

// The descriptor state derives privately from the operation that carries
// its ready events; a C-style cast is the one that reaches such a base.
bool PeerStoppedWriting(const boost::asio::detail::epoll_reactor::descriptor_state* state) {
    const unsigned int events = ((const Operation*)state)->*MemberOf(ReadyEvents{});
    return (events & (EPOLLRDHUP | EPOLLHUP | EPOLLERR)) != 0;
}

}  // namespace detail

}  // namespace toolkit
