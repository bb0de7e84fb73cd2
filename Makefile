# Build, test and benchmark entry points. `make test` is the one command CI runs.
JOBS ?= $(shell nproc)
CMAKE_GEN := -G Ninja

.PHONY: deps build run test tsan bench format clean

deps:
	@bash scripts/install-deps.sh

build: deps
	@cmake -S . -B build $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
	@cmake --build build -j $(JOBS)

# Records a 60 s demo clip into recordings/demo/ and lists the stored objects.
run: build
	@bash scripts/run-demo.sh

# Unit and integration tests under AddressSanitizer and UndefinedBehaviorSanitizer.
test: deps
	@cmake -S . -B build-asan $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Debug -DSFR_SANITIZE=address >/dev/null
	@cmake --build build-asan -j $(JOBS)
	@cd build-asan && ctest --output-on-failure -j $(JOBS) --timeout 600

# Under ThreadSanitizer: the concurrency tests (suites whose name holds "Concurrency") and the
# in-process pipeline (suites holding "Pipeline"), where every thread of the recorder runs.
tsan: deps
	@cmake -S . -B build-tsan $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Debug -DSFR_SANITIZE=thread >/dev/null
	@cmake --build build-tsan -j $(JOBS)
	@cd build-tsan && ctest --output-on-failure -j $(JOBS) --timeout 600 -R 'Concurrency|Pipeline'

bench: deps
	@cmake -S . -B build-bench $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Release -DSFR_BENCH=ON >/dev/null
	@cmake --build build-bench -j $(JOBS)
	@for b in build-bench/bench/bench_*; do [ -x "$$b" ] && "$$b"; done
	@bash bench/compare_segmenter.sh build-bench

format:
	@git ls-files '*.cpp' '*.h' | xargs clang-format -i

clean:
	@rm -rf build build-asan build-tsan build-bench
