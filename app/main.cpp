#include "Application.h"
#include "TetherTask.h"

int main(int argc, char** argv) {
  return platform::applicationMain(argc, argv, [] {
    auto task = std::make_shared<TetherTask>();
    task->awakeFromNib();
    return task;
  });
}
