#include "Thread.h"

#include <pthread.h>

#include <system_error>
#include <thread>

namespace platform {
namespace {

std::atomic<int> lastNumber{0};
thread_local std::shared_ptr<Thread> currentThread;

}  // namespace

void startDetached(std::function<void()> body) {
  try {
    std::thread(std::move(body)).detach();
  } catch (const std::system_error& error) {
    throw std::system_error(error.code(), "no thread");
  }
}

Thread::Thread(std::function<void()> body) : _number(++lastNumber), _body(std::move(body)) {}

std::shared_ptr<Thread> Thread::make(std::function<void()> body) {
  return std::shared_ptr<Thread>(new Thread(std::move(body)));
}

std::shared_ptr<Thread> Thread::current() {
  if (!currentThread) {
    currentThread = make(nullptr);
    const Guard guard(currentThread->_lock);
    currentThread->_runLoop = RunLoop::current();
  }
  return currentThread;
}

void Thread::start() {
  // The loop is made here, where it can be told that there is none to be had.
  startDetached([self = shared_from_this(), loop = RunLoop::make()] { self->main(loop); });
}

void Thread::main(const std::shared_ptr<RunLoop>& loop) {
  currentThread = shared_from_this();
  RunLoop::setCurrent(loop);
  {
    const Guard guard(_lock);
    _runLoop = loop;
    _changed.notifyAll();
  }
  _body();
  _body = nullptr;
  RunLoop::endCurrent();
  const Guard guard(_lock);
  _finished = true;
  _changed.notifyAll();
}

void Thread::cancel() {
  _cancelled = true;
  std::shared_ptr<RunLoop> loop;
  {
    const Guard guard(_lock);
    loop = _runLoop;
  }
  if (loop) loop->wakeUp();
}

void Thread::join() {
  const Guard guard(_lock);
  while (!_finished) _changed.wait(_lock);
}

std::shared_ptr<RunLoop> Thread::runLoop() {
  const Guard guard(_lock);
  while (!_runLoop) _changed.wait(_lock);
  return _runLoop;
}

void Thread::setCurrentName(const std::string& name) {
  // The system keeps 15 characters; description() has them all.
#if defined(__APPLE__)
  pthread_setname_np(name.c_str());
#else
  pthread_setname_np(pthread_self(), name.substr(0, 15).c_str());
#endif
  const auto self = current();
  const Guard guard(self->_lock);
  self->_name = name;
}

std::string Thread::description() const {
  const Guard guard(_lock);
  return "<thread " + std::to_string(_number) + (_name.empty() ? ">" : ": " + _name + ">");
}

}  // namespace platform
