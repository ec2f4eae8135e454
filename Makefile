# The two commands of the README, and the steps they are made of.
# The packages are those of the Debian release that runs make: Debian 12 ships
# Boost 1.81 beside its default 1.74, Debian 13 has 1.83 as its default; the
# fuzzers link the runtime of the release's clang.
RELEASE := $(shell . /etc/os-release && echo $$VERSION_CODENAME)
BOOST_bookworm := 1.81
BOOST_trixie := 1.83
CLANG_bookworm := 14
CLANG_trixie := 19
BOOST := $(BOOST_$(RELEASE))
CLANG := $(CLANG_$(RELEASE))
$(if $(BOOST),,$(error torvad builds on Debian 12 (bookworm) or 13 (trixie), not on '$(RELEASE)'))
PACKAGES := libboost$(BOOST)-dev libboost-filesystem$(BOOST)-dev libgtest-dev \
            libgmock-dev libbenchmark-dev cmake ninja-build g++ redis-server python3
# For the fuzzers and the format check only.
CLANG_PACKAGES := clang libclang-rt-$(CLANG)-dev clang-format
FUZZ_SECONDS ?= 30
# The version, which CMakeLists.txt names once.
VERSION := $(shell sed -n '/^project/s/.* VERSION \([0-9.]*\).*/\1/p' CMakeLists.txt)

.PHONY: all deps clang-deps build run package test test-asan test-system fuzz matcher-equality bench \
        format format-check clean windows windows-deps wine-deps test-windows container-deps image \
        test-container test-debian13

all: build

# Installs only what is missing, so a prepared machine starts at once.
deps:
	@dpkg -s $(PACKAGES) >/dev/null 2>&1 || { \
	  apt-get update && DEBIAN_FRONTEND=noninteractive apt-get install -y $(PACKAGES); }

clang-deps:
	@dpkg -s $(CLANG_PACKAGES) >/dev/null 2>&1 || { \
	  apt-get update && DEBIAN_FRONTEND=noninteractive apt-get install -y $(CLANG_PACKAGES); }

build/build.ninja:
	cmake -S . -B build -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo

build: deps build/build.ninja
	cmake --build build

# The demo product in examples/demo: core is found there, the init script runs
# through the stand-in interpreter, core fails once so its restart shows, and
# the product is ready (-r) once the second core says so.
# DEMO_CORE=examples/demo_core.py runs the core written in Python instead.
DEMO_CORE ?= build/demo_core
run: build
	cp $(DEMO_CORE) examples/demo/core
	rm -f examples/demo/failed-once.marker
	PYTHONPATH="$(CURDIR)/peer/python" PATH="$(CURDIR)/examples/demo/bin:$$PATH" \
	  ./build/torvad -v -r -d examples/demo

# A Debian package of what `cmake --install` puts in place.
# dpkg-shlibdeps names the libraries it needs, which CPack finds with file(1).
package: build
	@dpkg -s dpkg-dev file >/dev/null 2>&1 || { apt-get update && \
	  DEBIAN_FRONTEND=noninteractive apt-get install -y dpkg-dev file; }
	cd build && cpack -G DEB

# The format check, the sanitizer run, the fuzzers, the system test and the
# Windows build's tests first, so the summary of the plain run ends the output.
test: build
	$(MAKE) format-check
	$(MAKE) test-asan
	$(MAKE) fuzz
	$(MAKE) test-system
	$(MAKE) test-windows
	$(MAKE) test-container
	ctest --test-dir build --output-on-failure -j2

# The package on a real systemd, booted in namespaces of its own over a
# throw-away overlay of / (never on the machine's own /: its tmpfiles step
# would empty /tmp). Needs root; about a minute.
test-system: package
	@dpkg -s systemd util-linux redis-server >/dev/null 2>&1 || { apt-get update && \
	  DEBIAN_FRONTEND=noninteractive apt-get install -y systemd util-linux redis-server; }
	tests/system/run.sh build/torvad_$(VERSION)_amd64.deb build/demo_core

# --- The OCI image: torvad and the demo product, FROM scratch, offline -------
# podman's network backend: CNI on Debian 12; Debian 13's podman has only netavark.
NETWORK_bookworm := containernetworking-plugins
NETWORK_trixie := netavark nftables
CONTAINER_PACKAGES := podman runc conmon $(NETWORK_$(RELEASE)) catatonit busybox-static
# podman on the build's own storage: the machine's image store stays as it was.
IMAGE_PODMAN := packaging/container/podman.sh build/containers

container-deps:
	@dpkg -s $(CONTAINER_PACKAGES) >/dev/null 2>&1 || { apt-get update && \
	  DEBIAN_FRONTEND=noninteractive apt-get install -y $(CONTAINER_PACKAGES); }

# build/torvad-image.tar, an OCI archive: `podman load -i` it, or copy it to a registry.
image: build container-deps
	packaging/container/stage.sh build build/image-root
	$(IMAGE_PODMAN) build -q -f packaging/container/Containerfile -t localhost/torvad:$(VERSION) \
	  build/image-root
	rm -f build/torvad-image.tar
	$(IMAGE_PODMAN) save -q --format oci-archive -o build/torvad-image.tar localhost/torvad:$(VERSION)
	$(IMAGE_PODMAN) image prune -f >/dev/null

# The image under podman with runc, and the Kubernetes manifest through
# `podman kube play`, on a storage folder of the test's own. About a minute.
test-container: image
	tests/container/run.sh build/torvad-image.tar deploy/kubernetes/torvad.yaml

# --- Debian 13: the README's commands on the other release ---------------------
# In a Debian 13 root made with debootstrap and kept in build-debian13: make
# build, the plain tests, make run until core's restart, and make windows.
# Needs root; leaves no mount and no process behind.
test-debian13:
	@command -v debootstrap >/dev/null || { apt-get update && \
	  DEBIAN_FRONTEND=noninteractive apt-get install -y debootstrap; }
	.ci/debian13 build-debian13

build-asan/build.ninja:
	cmake -S . -B build-asan -G Ninja -DCMAKE_BUILD_TYPE=Debug -DTORVAD_SANITIZE=ON

# A small quarantine: the memory rows measure what torvad holds, not what ASan keeps.
test-asan: deps build-asan/build.ninja
	cmake --build build-asan
	ASAN_OPTIONS=detect_leaks=1:quarantine_size_mb=16 UBSAN_OPTIONS=halt_on_error=1:print_stacktrace=1 \
	  ctest --test-dir build-asan --output-on-failure -j2

build-fuzz/build.ninja:
	CXX=clang++ cmake -S . -B build-fuzz -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	  -DTORVAD_FUZZ=ON -DTORVAD_SANITIZE=ON

# Each target for FUZZ_SECONDS, from its committed seeds and the corpus it grew
# before. An input of fuzz_regex is a pattern, a newline and a text, 64 bytes each
# at most. It starts two threads per input, and ASan keeps some 6 kB for every
# thread ever started: hence a larger limit on the process, and its own on one
# allocation.
FUZZ_TARGETS := framing execute regex
FUZZ_FLAGS_regex := -max_len=129 -dict=fuzz/regex.dict -rss_limit_mb=8192 -malloc_limit_mb=1024
# Not among the targets: the survey of Boost.Regex as the matcher, which differs
# (make fuzz FUZZ_TARGETS=regex_boost; FUZZ_REGEX_DIFFERENCES=FILE lists each).
FUZZ_FLAGS_regex_boost := $(FUZZ_FLAGS_regex)
fuzz: deps clang-deps build-fuzz/build.ninja
	cmake --build build-fuzz --target $(addprefix fuzz_,$(FUZZ_TARGETS))
	$(foreach target,$(FUZZ_TARGETS),mkdir -p build-fuzz/corpus_$(target) && \
	  ./build-fuzz/fuzz/fuzz_$(target) -max_total_time=$(FUZZ_SECONDS) -print_final_stats=1 \
	    $(FUZZ_FLAGS_$(target)) -artifact_prefix=build-fuzz/$(target)- \
	    build-fuzz/corpus_$(target) fuzz/seeds_$(target) && ) true

# The parser's automata against libstdc++ 12's own compiler, node for node, over
# the regex fuzzer's dictionary, seeds and grown corpus; builds only where the
# fuzz build's library is libstdc++ 12. Not part of `make test`.
matcher-equality: deps clang-deps build-fuzz/build.ninja
	cmake --build build-fuzz --target matcher_equality
	./build-fuzz/fuzz/matcher_equality fuzz/regex.dict fuzz/seeds_regex build-fuzz/corpus_regex

bench: build
	./build/bench/bench_framing
	./build/bench/bench_restart
	./build/bench/bench_execute
	./build/bench/bench_relay
	./build/bench/bench_memory
	./build/bench/bench_scale

format:
	clang-format -i $$(git ls-files '*.cpp' '*.hpp')

format-check: clang-deps
	clang-format --dry-run -Werror $$(git ls-files '*.cpp' '*.hpp')

clean:
	rm -rf build build-asan build-fuzz $(WIN) build-debian13

# --- Windows: cross-built with mingw-w64, its tests run under Wine ------------
WINDOWS_PACKAGES := g++-mingw-w64-x86-64-posix libboost$(BOOST)-dev googletest cmake ninja-build \
                    xz-utils
# locales: the code page row builds a ja_JP locale of its own with localedef.
WINE_PACKAGES := wine wine64 locales
WIN := build-windows
# Boost's headers through a folder that holds only boost/, and the source of
# Boost.Filesystem's compiled part, which Debian builds for Linux only.
WIN_BOOST := $(WIN)/boost
# apt's own configuration for the source package, so the machine's stays as it was.
WIN_APT := $(CURDIR)/$(WIN)/apt
WIN_APT_OPTIONS := -o Dir::Etc::SourceList=/dev/null -o Dir::Etc::SourceParts=$(WIN_APT)/sources.list.d \
  -o Dir::State::Lists=$(WIN_APT)/lists -o Dir::Cache=$(WIN_APT)/cache -o APT::Sandbox::User=root
WINE_ENV := WINEPREFIX=$(CURDIR)/$(WIN)/wine WINEDEBUG=-all WINEDLLOVERRIDES="mscoree,mshtml="

windows-deps:
	@dpkg -s $(WINDOWS_PACKAGES) >/dev/null 2>&1 || { \
	  apt-get update && DEBIAN_FRONTEND=noninteractive apt-get install -y $(WINDOWS_PACKAGES); }

wine-deps:
	@dpkg -s $(WINE_PACKAGES) >/dev/null 2>&1 || { \
	  apt-get update && DEBIAN_FRONTEND=noninteractive apt-get install -y $(WINE_PACKAGES); }

$(WIN_BOOST)/filesystem/src/operations.cpp:
	mkdir -p $(WIN_APT)/sources.list.d $(WIN_APT)/lists/partial $(WIN_APT)/cache/archives/partial \
	  $(WIN_BOOST)/source $(WIN_BOOST)/include $(WIN_BOOST)/filesystem
	sed 's/@RELEASE@/$(RELEASE)/' cmake/boost-source.list >$(WIN_APT)/sources.list.d/boost-source.list
	apt-get $(WIN_APT_OPTIONS) update
	cd $(WIN_BOOST)/source && apt-get $(WIN_APT_OPTIONS) source --download-only boost$(BOOST)
	tar -xJf $(WIN_BOOST)/source/boost$(BOOST)_$(BOOST).0.orig.tar.xz -C $(WIN_BOOST)/filesystem \
	  --strip-components=3 --wildcards '*/libs/filesystem/src/*'
	ln -sfn /usr/include/boost $(WIN_BOOST)/include/boost

$(WIN)/build.ninja: | $(WIN_BOOST)/filesystem/src/operations.cpp
	cmake -S . -B $(WIN) -G Ninja -DCMAKE_BUILD_TYPE=Release -DCMAKE_CXX_FLAGS_RELEASE="-O2 -DNDEBUG" \
	  -DCMAKE_TOOLCHAIN_FILE=cmake/windows-toolchain.cmake -DTORVAD_BOOST_WINDOWS=$(CURDIR)/$(WIN_BOOST)

windows: windows-deps $(WIN)/build.ninja
	cmake --build $(WIN)

# One Wine prefix for the build, made once; one wineserver kept for the run,
# so that each test program doesn't start its own. The session's own programs
# (its service manager and devices) start first, on /dev/null: started by a
# test they would hold that test's output open for as long as they run.
# The unit tests are the Windows build's own; the end-to-end tests are this
# system's, driving the Windows build's programs.
test-windows: windows build wine-deps
	test -f $(WIN)/wine/system.reg || $(WINE_ENV) wineboot --init </dev/null >/dev/null 2>&1
	$(WINE_ENV) wineserver --kill 2>/dev/null; $(WINE_ENV) wineserver --persistent </dev/null >/dev/null 2>&1
	$(WINE_ENV) wine cmd /c exit </dev/null >/dev/null 2>&1
	$(WINE_ENV) ctest --test-dir $(WIN) --output-on-failure -j2 && \
	  $(WINE_ENV) TORVAD_WINDOWS_BUILD=$(CURDIR)/$(WIN) ctest --test-dir build -L e2e \
	    --output-on-failure -j2; status=$$?; $(WINE_ENV) wineserver --kill; exit $$status
