// The volume list walk of UpdateUtil::IsThereAvailVolPath keeps the nodes before its stop on
// purpose (see the library); a sanitizer build of this program must not count them.  The
// sanitizer runtime looks the hook up dynamically: it must be exported despite the hidden
// default visibility of this build.
extern "C" __attribute__((visibility("default"))) const char* __lsan_default_suppressions() {
    return "leak:IsThereAvailVolPath\n";
}
