// Waiting for bytes to arrive on a socket of the loop without the system
// call that asio spends on starting every readiness wait.
//
// asio registers a socket with its epoll set once, edge-triggered, and its
// async_wait re-arms the registration with epoll_ctl each time, so that bytes
// already there end the wait at once. A reader that reads until the socket is
// empty needs no re-arming: the next byte to arrive makes a new edge.
// AwaitArrival queues a wait that only such an edge (or an error, a hang-up,
// a close) ends: a message costs one system call fewer.
//
// The rules for its user: take the socket's ArrivalWatch once; start
// the wait only right after a read that left the socket empty, before the
// loop runs again (an edge the loop saw while no wait was queued is gone).
// A short read means empty only after an AwaitArrival that did not report
// the peer stopping: after asio's async_wait (the first wait, which also
// sees bytes that came before it), after a turn that read on without a
// wait, and once the peer stopped writing, the end of the stream may wait
// behind the bytes, so read until a read returns 0 or EAGAIN.
#ifndef TOOLKIT_ARRIVAL_H_
#define TOOLKIT_ARRIVAL_H_

#include <boost/asio/basic_stream_socket.hpp>
#include <boost/asio/detail/epoll_reactor.hpp>
#include <boost/asio/detail/reactor_op.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/local/stream_protocol.hpp>
#include <utility>

#if !defined(BOOST_ASIO_HAS_EPOLL)
#error "AwaitArrival needs asio's epoll reactor"
#endif

namespace toolkit {

using LocalSocket = boost::asio::basic_stream_socket<boost::asio::local::stream_protocol,
                                                     boost::asio::io_context::executor_type>;

// asio's epoll descriptor for the loop of `context` (its timers and wake-up
// are in that set too).
int ReactorDescriptor(boost::asio::io_context& axContext);

// What the arrival waits of one socket need, taken once: the socket's
// registration also reports a peer that shut down its writing side
// (EPOLLRDHUP, one epoll_ctl), and the reactor is looked up (under the
// context's lock) here rather than per wait. False when that failed: the
// socket's waits are then asio's async_wait.
class ArrivalWatch {
  public:
    explicit operator bool() const { return reactor != nullptr; }
    boost::asio::detail::epoll_reactor* reactor = nullptr;
};
ArrivalWatch WatchPeerShutdown(LocalSocket& axSocket);

namespace detail {

// Whether the readiness event being handled for `state` says the peer
// stopped writing (a shut-down writing side, a hang-up or an error).
bool PeerStoppedWriting(const boost::asio::detail::epoll_reactor::descriptor_state* state);

// The socket's descriptor and reactor registration, which asio keeps
// protected: reached through a member pointer named in a derived class.
struct SocketAccess : LocalSocket {
    static auto& Implementation(LocalSocket& axSocket) {
        return (axSocket.*(&SocketAccess::impl_)).get_implementation();
    }
};

// The memory of the last finished wait, which the next takes: a wait per
// message should not cost an allocation.
struct SpareBlock {
    void* block = nullptr;
    ~SpareBlock() { ::operator delete(block); }
};
inline thread_local SpareBlock tSpareArrival;

// A reactor operation that performs nothing: asked when it is queued, it is
// not done; asked for a readiness event of the socket, it is, and notes
// whether the event says the peer stopped writing.
template <class Handler>
class ArrivalOp : public boost::asio::detail::reactor_op {
  public:
    ArrivalOp(Handler&& handler, const boost::asio::detail::epoll_reactor::descriptor_state* state)
        : reactor_op(boost::system::error_code(), &ArrivalOp::Perform, &ArrivalOp::Complete),
          handler_(std::move(handler)),
          state_(state) {}
    bool queued = false;

    static void* operator new(std::size_t) {
        static_assert(sizeof(ArrivalOp) <= kBlockSize, "the spare block holds every wait");
        if (void* spare = std::exchange(tSpareArrival.block, nullptr)) return spare;
        return ::operator new(kBlockSize);
    }
    static void operator delete(void* block) {
        if (tSpareArrival.block == nullptr) {
            tSpareArrival.block = block;
        } else {
            ::operator delete(block);
        }
    }

  private:
    static constexpr std::size_t kBlockSize = 128;
    static status Perform(reactor_op* base) {
        auto* op = static_cast<ArrivalOp*>(base);
        if (!op->queued) return not_done;
        op->stopped_ = PeerStoppedWriting(op->state_);
        return done;
    }
    // `owner` is null when the loop is destroyed with the wait queued.
    static void Complete(void* owner, boost::asio::detail::scheduler_operation* base,
                         const boost::system::error_code&, std::size_t) {
        auto* op = static_cast<ArrivalOp*>(base);
        Handler handler(std::move(op->handler_));
        const boost::system::error_code error = op->ec_;
        const bool stopped = op->stopped_;
        delete op;
        if (owner != nullptr) handler(error, stopped);
    }
    Handler handler_;
    const boost::asio::detail::epoll_reactor::descriptor_state* state_;
    bool stopped_ = false;
};

}  // namespace detail

// Calls handler(error, peerStoppedWriting) from the loop once bytes arrive
// on `socket` after this call (error set when the socket failed or was
// closed). `watch` is the socket's, and true.
template <class Handler>
void AwaitArrival(const ArrivalWatch& axWatch, LocalSocket& axSocket, Handler handler) {
    auto& implementation = detail::SocketAccess::Implementation(axSocket);
    auto* op = new detail::ArrivalOp<Handler>(std::move(handler), implementation.reactor_data_);
    axWatch.reactor->start_op(boost::asio::detail::epoll_reactor::read_op, implementation.socket_,
                              implementation.reactor_data_, op, true, true);
    op->queued = true;  // still ours: a queued or posted operation runs only from the loop
}

}  // namespace toolkit

#endif  // TOOLKIT_ARRIVAL_H_
