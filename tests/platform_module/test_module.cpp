// A module for the module service to find: one exported function and nothing else.
extern "C" __attribute__((visibility("default"))) int telv_test_module_answer(int question) {
    return question * 2 + 1;
}
