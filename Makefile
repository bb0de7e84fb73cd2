# Build, test and benchmark entry points. `make test` is the one command CI runs.
JOBS ?= $(shell nproc)
CMAKE_GEN := -G Ninja

.PHONY: deps build run test tsan fuzz bench format lint clean

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

# Under ThreadSanitizer: the tests labelled "concurrency" in tests/CMakeLists.txt (threads
# racing, and the in-process pipeline where every thread of the recorder runs).
tsan: deps
	@cmake -S . -B build-tsan $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Debug -DSFR_SANITIZE=thread >/dev/null
	@cmake --build build-tsan -j $(JOBS)
	@cd build-tsan && ctest --output-on-failure -j $(JOBS) --timeout 600 -L concurrency

# The segment writer fuzz test for FUZZ_SECONDS with a random seed, which it prints; replay a
# seed with `make fuzz SEED=<seed>`. `make test` runs it briefly with a fixed seed.
FUZZ_SECONDS ?= 60
SEED ?=
fuzz: deps
	@cmake -S . -B build-asan $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Debug -DSFR_SANITIZE=address >/dev/null
	@cmake --build build-asan -j $(JOBS) --target SegmentWriterFuzzTest
	@seed=$(SEED); seed=$${seed:-$$(od -An -N4 -tu4 /dev/urandom | tr -d ' ')}; \
	  echo "fuzz seed $$seed (replay: make fuzz SEED=$$seed)"; \
	  SFR_FUZZ_SEED=$$seed SFR_FUZZ_SECONDS=$(FUZZ_SECONDS) build-asan/tests/SegmentWriterFuzzTest

bench: deps
	@cmake -S . -B build-bench $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Release -DSFR_BENCH=ON >/dev/null
	@cmake --build build-bench -j $(JOBS)
	@for b in build-bench/bench/bench_*; do [ -x "$$b" ] && "$$b"; done
	@bash bench/compare_segmenter.sh build-bench
	@N=50 DURATION=40 bash bench/scale.sh build-bench

format:
	@git ls-files '*.cpp' '*.h' | xargs clang-format -i

# The format check and clang-tidy (.clang-tidy) over the product's sources; any finding fails.
lint: deps
	@git ls-files '*.cpp' '*.h' | xargs clang-format --dry-run --Werror
	@cmake -S . -B build-lint $(CMAKE_GEN) -DCMAKE_EXPORT_COMPILE_COMMANDS=ON >/dev/null
	@git ls-files 'src/*.cpp' 'modulebase/*.cpp' 'platform/*.cpp' 'crashreport/*.cpp' | \
	  xargs -P $(JOBS) -n 4 clang-tidy -p build-lint --quiet 2>/dev/null

clean:
	@rm -rf build build-asan build-tsan build-bench build-lint
