#include "tessarine/ThreadCreator.h"

#include <utility>

ThreadCreator::~ThreadCreator() = default;

std::thread StdThreadCreator::createThread(std::function<void()> body) { return std::thread(std::move(body)); }
