# The two commands a new user runs: `make run` and `make test`.
JOBS ?= $(shell nproc)
BUILD_DIR ?= build
TEST_DIR ?= build-asan
TSAN_DIR ?= build-tsan
# The tests that run threads of the gathering.
TSAN_TESTS ?= HTHeftGather*

.PHONY: all setup build run test bench clean

all: build

setup:
	@./scripts/setup.sh

build: setup
	cmake -S . -B $(BUILD_DIR) -DCMAKE_BUILD_TYPE=Release -DHEFT_BUILD_TESTS=OFF
	cmake --build $(BUILD_DIR) -j $(JOBS)

# Builds heft and reports on every process of this machine.
run: build
	$(BUILD_DIR)/heft -a

# Runs the parallel gathering under ThreadSanitizer, then builds the whole
# suite under AddressSanitizer and UndefinedBehaviorSanitizer and runs it.
test: setup
	cmake -S . -B $(TSAN_DIR) -DCMAKE_BUILD_TYPE=Debug -DHEFT_SANITIZE=thread
	cmake --build $(TSAN_DIR) -j $(JOBS) --target heft_tests
	$(TSAN_DIR)/tests/heft_tests --gtest_filter='$(TSAN_TESTS)'
	cmake -S . -B $(TEST_DIR) -DCMAKE_BUILD_TYPE=Debug -DHEFT_SANITIZE=address
	cmake --build $(TEST_DIR) -j $(JOBS)
	cd $(TEST_DIR) && ctest --output-on-failure -j $(JOBS)

bench: setup
	cmake -S . -B build-bench -DCMAKE_BUILD_TYPE=Release -DHEFT_BUILD_TESTS=OFF -DHEFT_BUILD_BENCH=ON
	cmake --build build-bench -j $(JOBS)
	build-bench/bench/heft_bench

clean:
	rm -rf $(BUILD_DIR) $(TEST_DIR) build-tsan build-bench
