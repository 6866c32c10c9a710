// A camera may announce a file of 4 GiB. There need not be memory for it, but there must be an answer.

extern "C" {
#define OPTIONS "allocator_may_return_null=1:max_allocation_size_mb=256"
[[gnu::visibility("default")]] const char* __asan_default_options();
[[gnu::visibility("default")]] const char* __tsan_default_options();
const char* __asan_default_options() { return OPTIONS; }
const char* __tsan_default_options() { return OPTIONS; }
}
