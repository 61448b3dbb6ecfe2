# Front door: every target installs what is missing, configures and builds as needed.
PREFIX ?= /usr/local
FUZZ_SECONDS ?= 60
PELMORAD_ARGS ?=

.PHONY: all deps build test run asan tsan analyze bench fuzz install format clean

all: build

deps:
	@./scripts/install-deps.sh

build: deps
	cmake --preset default
	cmake --build --preset default

test: build
	ctest --preset default

# The management daemon in the foreground on its compiled-in defaults; it prints the URL
# to open (http://127.0.0.1:8080/). Ctrl-C stops it. PELMORAD_ARGS adds flags
# (make run PELMORAD_ARGS="--port 9090").
run: deps
	cmake --preset default
	cmake --build --preset default --target pelmorad
	./build/default/tools/pelmorad/pelmorad --state-dir build/pelmorad-state $(PELMORAD_ARGS)

asan: deps
	cmake --preset asan
	cmake --build --preset asan
	ctest --preset asan

tsan: deps
	cmake --preset tsan
	cmake --build --preset tsan
	setarch $$(uname -m) -R ctest --preset tsan

# Clang's thread-safety analysis over the library; any finding fails the build.
analyze: deps
	cmake --preset analyze
	cmake --build --preset analyze

bench: deps
	cmake --preset bench
	cmake --build --preset bench
	./scripts/run-benchmarks.sh build/bench/bench

fuzz: deps
	cmake --preset fuzz
	cmake --build --preset fuzz
	./scripts/run-fuzzers.sh build/fuzz/fuzz $(FUZZ_SECONDS)

install: build
	cmake --install build/default --prefix $(PREFIX)

format:
	git ls-files '*.h' '*.cpp' | xargs clang-format -i

clean:
	rm -rf build
