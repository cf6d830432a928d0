#if defined(__SANITIZE_THREAD__)
// libutils is not built for ThreadSanitizer, so it cannot see that RefBase's reference count
// orders every access before the delete: an object freed by the last decStrong on another
// thread than its last user would be reported as a race. Likewise glibc's time zone state, which
// localtime_r and mktime change under a lock of glibc's own that the sanitizer does not see.
extern "C" const char* __tsan_default_suppressions() {
    return "race:android::RefBase::decStrong\n"
           "race:tzset_internal\n";
}
#endif
