#include <iostream>  // needs the C++ runtime, as every program in C++ does

int main() {}
