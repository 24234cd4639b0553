// The volume list walk of UpdateUtil::IsThereAvailVolPath keeps the nodes before its stop on
// purpose (see the library); a sanitizer build of this program must not count them.
extern "C" const char* __lsan_default_suppressions() {
    return "leak:IsThereAvailVolPath\n";
}
