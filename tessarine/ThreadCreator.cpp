#include "tessarine/ThreadCreator.h"

ThreadCreator::~ThreadCreator() = default;
