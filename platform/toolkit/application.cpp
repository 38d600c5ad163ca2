#include "toolkit/application.h"

#include <boost/asio/post.hpp>

#include "toolkit/userinterface.h"

Application& Application::Get() {
    // Never destroyed: handlers of objects that outlive main may still refer to it.
    static Application* application = new Application();
    return *application;
}

void Application::Execute() {
    MarkUserInterfaceThread();
    ++executing_;
    while (!quitting_) {
        if (context_.stopped()) context_.restart();
        // Wakes at least every 100 ms, so that Quit() from a handler ends the loop.
        context_.run_one_for(std::chrono::milliseconds(100));
    }
    --executing_;
}

void Application::Quit() {
    quitting_ = true;
}

void Application::ResetQuit() {
    quitting_ = false;
}

void Application::Reschedule() {
    MarkUserInterfaceThread();
    if (context_.stopped()) context_.restart();
    context_.poll();
}

bool Application::RunOneFor(std::chrono::milliseconds timeout) {
    MarkUserInterfaceThread();
    if (context_.stopped()) context_.restart();
    bool ran = context_.run_one_for(timeout) > 0;
    return ran;
}

void Application::Wait(bool abWaiting) {
    waiting_ = abWaiting;
    UserInterface::Current()->SetWaiting(abWaiting);
}

void Application::PostUserEvent(unsigned long alId, void* pData) {
    boost::asio::post(context_, [this, alId, pData] {
        if (userEventHandler_) userEventHandler_(alId, pData);
    });
}

void Application::SetUserEventHandler(std::function<void(unsigned long, void*)> handler) {
    userEventHandler_ = std::move(handler);
}

Timer::Timer() : timer_(Application::Get().GetContext()) {}

Timer::~Timer() {
    ++*generation_;
    timer_.cancel();
}

void Timer::Start() {
    active_ = true;
    Arm();
}

void Timer::Stop() {
    active_ = false;
    ++*generation_;
    timer_.cancel();
}

void Timer::Arm() {
    unsigned long generation = ++*generation_;
    std::weak_ptr<unsigned long> alive = generation_;
    timer_.expires_after(std::chrono::milliseconds(timeout_));
    timer_.async_wait([this, alive, generation](const boost::system::error_code& error) {
        auto current = alive.lock();
        if (error || !current || *current != generation) return;
        Fired();
    });
}

void Timer::Fired() {
    active_ = false;
    handler_.Call(this);
}

void AutoTimer::Fired() {
    Arm();  // the next period starts before the handler, as a periodic timer does
    GetTimeoutHdl().Call(this);
}
