# The weighing of process name expressions over any text, and the C library's compiler over every
# expression it lets through.
tarn_fuzz_target(expression_budget expression_budget.cpp
                 ${PROJECT_SOURCE_DIR}/src/telvzmnd/core/expression_budget.cpp)
target_compile_options(fuzz_expression_budget PRIVATE -fno-exceptions -fno-rtti)
