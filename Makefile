# The two commands of the README, and the steps they are made of.
PACKAGES := libboost1.81-dev libboost-filesystem1.81-dev libsystemd-dev libgtest-dev \
            libgmock-dev libbenchmark-dev cmake ninja-build g++ clang libclang-rt-14-dev \
            clang-format pkg-config
FUZZ_SECONDS ?= 60

.PHONY: all deps build run test test-asan fuzz bench format clean

all: build

# Installs only what is missing, so a prepared machine starts at once.
deps:
	@dpkg -s $(PACKAGES) >/dev/null 2>&1 || { \
	  apt-get update && DEBIAN_FRONTEND=noninteractive apt-get install -y $(PACKAGES); }

build/build.ninja:
	cmake -S . -B build -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo

build: deps build/build.ninja
	cmake --build build

run: build
	./build/torvad -d examples/demo -- $(CURDIR)/build/peer_example

# The sanitizer run and the fuzzer first, so the summary of the plain run ends the output.
test: build
	$(MAKE) test-asan
	$(MAKE) fuzz
	ctest --test-dir build --output-on-failure -j2

build-asan/build.ninja:
	cmake -S . -B build-asan -G Ninja -DCMAKE_BUILD_TYPE=Debug -DTORVAD_SANITIZE=ON

test-asan: deps build-asan/build.ninja
	cmake --build build-asan
	ASAN_OPTIONS=detect_leaks=1 UBSAN_OPTIONS=halt_on_error=1:print_stacktrace=1 \
	  ctest --test-dir build-asan --output-on-failure -j2

build-fuzz/build.ninja:
	CXX=clang++ cmake -S . -B build-fuzz -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	  -DTORVAD_FUZZ=ON -DTORVAD_SANITIZE=ON

# An input of fuzz_regex is a pattern, a newline and a text, 64 bytes each at most.
# It starts two threads per input, and ASan keeps some 6 kB for every thread
# ever started: hence a larger limit on the process, and its own on one allocation.
fuzz: deps build-fuzz/build.ninja
	cmake --build build-fuzz --target fuzz_framing fuzz_regex
	mkdir -p build-fuzz/corpus build-fuzz/corpus_regex
	./build-fuzz/fuzz/fuzz_framing -max_total_time=$(FUZZ_SECONDS) -print_final_stats=1 \
	  -artifact_prefix=build-fuzz/ \
	  build-fuzz/corpus fuzz/seeds
	./build-fuzz/fuzz/fuzz_regex -max_total_time=$(FUZZ_SECONDS) -print_final_stats=1 \
	  -max_len=129 -dict=fuzz/regex.dict -rss_limit_mb=8192 -malloc_limit_mb=1024 \
	  -artifact_prefix=build-fuzz/regex- \
	  build-fuzz/corpus_regex fuzz/seeds_regex

bench: build
	./build/bench/bench_framing
	./build/bench/bench_restart

format:
	clang-format -i $$(git ls-files '*.cpp' '*.hpp')

clean:
	rm -rf build build-asan build-fuzz
