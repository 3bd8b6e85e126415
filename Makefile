# Entry points. Every target installs what is missing first, so each works on a fresh machine.
BUILD      ?= build
ASAN_BUILD ?= build-asan
TSAN_BUILD ?= build-tsan
FUZZ_BUILD ?= build-fuzz
JOBS       ?= 2
FUZZ_SECONDS ?= 60

.PHONY: all deps build test test-asan test-tsan fuzz bench demo deb boot-test cross-arm64 cross-armhf \
	cross-deb-arm64 cross-deb-armhf format clean

all: build

deps:
	@scripts/install-deps.sh

$(BUILD)/build.ninja: | deps
	cmake -S . -B $(BUILD) -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo

$(ASAN_BUILD)/build.ninja: | deps
	cmake -S . -B $(ASAN_BUILD) -G Ninja -DCMAKE_BUILD_TYPE=Debug -DTAVRIX_SANITIZE=ON -DTAVRIX_BENCH=OFF

$(TSAN_BUILD)/build.ninja: | deps
	cmake -S . -B $(TSAN_BUILD) -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTAVRIX_TSAN=ON -DTAVRIX_BENCH=OFF

$(FUZZ_BUILD)/build.ninja: | deps
	CXX=clang++ cmake -S . -B $(FUZZ_BUILD) -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTAVRIX_FUZZ=ON

build: deps $(BUILD)/build.ninja
	cmake --build $(BUILD) -j $(JOBS)

test: build
	ctest --test-dir $(BUILD) -j $(JOBS) --output-on-failure

test-asan: deps $(ASAN_BUILD)/build.ninja
	cmake --build $(ASAN_BUILD) -j $(JOBS)
	ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
	    TAVRIX_CRASH_LOOP_ITERATIONS=8 ctest --test-dir $(ASAN_BUILD) -j $(JOBS) --output-on-failure

# Every test under the thread sanitizer: the daemon's worker threads, the queues and the
# integration tests' real daemons (each daemon's report lands in its log and fails the test).
test-tsan: deps $(TSAN_BUILD)/build.ninja
	cmake --build $(TSAN_BUILD) -j $(JOBS)
	TSAN_OPTIONS="halt_on_error=1 second_deadlock_stack=1 suppressions=$(CURDIR)/tests/tsan.supp" \
	    TAVRIX_CRASH_LOOP_ITERATIONS=8 ctest --test-dir $(TSAN_BUILD) -j $(JOBS) --output-on-failure

fuzz: deps $(FUZZ_BUILD)/build.ninja
	cmake --build $(FUZZ_BUILD) -j $(JOBS) --target fuzz_targets
	tests/fuzz/run.sh $(FUZZ_BUILD) $(FUZZ_SECONDS)

bench: build
	bench/run.sh $(BUILD)

demo: build
	scripts/demo.sh $(BUILD)

# The Debian packages (the daemon, the client library and its -dev), built from debian/ and
# checked by lintian; the .deb files land in dist/.
deb:
	@scripts/install-deps.sh --deb
	DEB_BUILD_OPTIONS="parallel=$(JOBS) nocheck" dpkg-buildpackage -us -uc -b
	mkdir -p dist && version=$$(dpkg-parsechangelog -S Version) && \
	    mv ../tavrixservicesd*_$${version}_*.* ../libtavrixclient*_$${version}_*.* dist/
	lintian --fail-on error,warning dist/*.deb

# The packages just built, booted in a Debian 12 container with systemd as PID 1 (root only).
boot-test: deb
	scripts/boot-test.sh

# Cross builds with Debian's cross toolchains into build-<arch>/, the unit tests run under qemu;
# both in a Debian 12 build root cached in /var/cache/tavrix-cross (root only).
cross-arm64:
	JOBS=$(JOBS) scripts/cross-build.sh arm64

cross-armhf:
	JOBS=$(JOBS) scripts/cross-build.sh armhf

# The Debian packages for another architecture (dpkg-buildpackage -a), into dist/<arch>/.
cross-deb-arm64:
	JOBS=$(JOBS) scripts/cross-build.sh --deb arm64

cross-deb-armhf:
	JOBS=$(JOBS) scripts/cross-build.sh --deb armhf

format:
	git ls-files '*.cpp' '*.h' | xargs clang-format -i

clean:
	rm -rf $(BUILD) $(ASAN_BUILD) $(TSAN_BUILD) $(FUZZ_BUILD) build-arm64 build-armhf dist obj-*
