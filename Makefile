# The two commands a new user runs: `make run` and `make test`.
JOBS ?= $(shell nproc)
BUILD_DIR ?= build
TEST_DIR ?= build-asan
TSAN_DIR ?= build-tsan
CLANG_DIR ?= build-clang
# The tests that run threads of the gathering.
TSAN_TESTS ?= HTHeftGather*

.PHONY: all setup build run test bench format lint clean

all: build

setup:
	@./scripts/setup.sh

build: setup
	cmake -S . -B $(BUILD_DIR) -DCMAKE_BUILD_TYPE=Release -DHEFT_BUILD_TESTS=OFF
	cmake --build $(BUILD_DIR) -j $(JOBS)

# Builds heft and reports on every process of this machine.
run: build
	$(BUILD_DIR)/heft -a

# Builds everything with clang and runs the unit tests; runs the parallel
# gathering under ThreadSanitizer; then builds the whole suite with gcc under
# AddressSanitizer and UndefinedBehaviorSanitizer and runs it. Warnings of
# either compiler are errors.
test: setup
	CC=clang CXX=clang++ cmake -S . -B $(CLANG_DIR) -DCMAKE_BUILD_TYPE=Release -DHEFT_WERROR=ON
	cmake --build $(CLANG_DIR) -j $(JOBS)
	cd $(CLANG_DIR) && ctest --output-on-failure -j $(JOBS) -LE e2e
	cmake -S . -B $(TSAN_DIR) -DCMAKE_BUILD_TYPE=Debug -DHEFT_SANITIZE=thread -DHEFT_WERROR=ON
	cmake --build $(TSAN_DIR) -j $(JOBS) --target heft_tests
	$(TSAN_DIR)/tests/heft_tests --gtest_filter='$(TSAN_TESTS)'
	cmake -S . -B $(TEST_DIR) -DCMAKE_BUILD_TYPE=Debug -DHEFT_SANITIZE=address -DHEFT_WERROR=ON
	cmake --build $(TEST_DIR) -j $(JOBS)
	cd $(TEST_DIR) && ctest --output-on-failure -j $(JOBS)

# Formats the sources in the house style (.clang-format).
format:
	find src tests bench -name '*.cpp' -o -name '*.h' -o -name '*.c' | xargs clang-format -i

# Checks the formatting and runs the checks of .clang-tidy.
lint: build
	find src tests bench -name '*.cpp' -o -name '*.h' -o -name '*.c' | xargs clang-format --dry-run --Werror
	run-clang-tidy -p $(BUILD_DIR) -quiet -j $(JOBS) '$(CURDIR)/src/'

bench: setup
	cmake -S . -B build-bench -DCMAKE_BUILD_TYPE=Release -DHEFT_BUILD_TESTS=OFF -DHEFT_BUILD_BENCH=ON
	cmake --build build-bench -j $(JOBS)
	build-bench/bench/heft_bench

clean:
	rm -rf $(BUILD_DIR) $(TEST_DIR) $(TSAN_DIR) $(CLANG_DIR) build-bench
