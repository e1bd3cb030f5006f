"""Fixtures of the end-to-end tests: `site` is an installation, `server` one that already runs in the foreground."""

import os

import pytest

import accounts
import harness


def pytest_configure(config):
    if not config.option.collectonly:
        try:
            harness.executable()
        except RuntimeError as error:
            raise pytest.UsageError(str(error)) from None
    harness.raise_descriptor_limit()


def pytest_report_header(config):
    build = {"": "plain", "address": "address sanitizer", "thread": "thread sanitizer"}[harness.SANITIZER]
    return f"ox_remote: {os.environ.get('OX_REMOTE', '(unset)')} ({build} build), run as uid {os.geteuid()}"


def pytest_collection_modifyitems(items):
    """The tests that mostly wait come first, shared out among the workers of a parallel run: each is handed a quarter of
    its share of all tests as one block at the start."""
    for item in items:
        if item.get_closest_marker("soak") and os.environ.get("OX_SOAK") != "1":
            item.add_marker(pytest.mark.skip(reason="long load run: set OX_SOAK=1"))
    waiting = [item for item in items if item.get_closest_marker("slow")]
    waiting += [item for item in items if item.get_closest_marker("daemon") and item not in waiting]
    others = [item for item in items if item not in waiting]
    workers = int(os.environ.get("PYTEST_XDIST_WORKER_COUNT", "1"))
    size = max(len(items) // workers // 4, 2)
    ordered = []
    for worker in range(workers):
        block = waiting[worker::workers]
        block += [others.pop(0) for _ in range(min(size - len(block), len(others)))]
        ordered += block
    items[:] = ordered + others


@pytest.hookimpl(hookwrapper=True)
def pytest_runtest_makereport(item, call):
    outcome = yield
    if call.when == "call":
        item.test_failed = outcome.get_result().failed


@pytest.fixture
def make_site(request):
    """Makes installations; at the end of the test each is stopped and its logs are checked."""
    sites = []

    def make():
        site = harness.Installation()
        sites.append(site)
        return site

    yield make
    faults = []
    for site in sites:
        try:
            faults += site.close()
            if faults or getattr(request.node, "test_failed", False):
                print(site.describe())
        finally:
            site.remove()
    if faults:
        pytest.fail("\n".join(faults), pytrace=False)


@pytest.fixture
def site(make_site):
    return make_site()


@pytest.fixture(params=["root", "lowered", "ordinary"])
def any_site(request, site):
    """An installation of root, one of root that lowers itself to another user, and one of an ordinary user. Each owns
    its files."""
    if request.param != "ordinary" and not harness.IS_ROOT:
        pytest.skip("needs root")
    if request.param == "lowered":
        site.configure(unix={"uid": 1, "gid": 1})
        site.give_to(1)
    elif request.param == "ordinary":
        site.use_ordinary_user()
    return site


@pytest.fixture
def machine(site):
    """An installation that asks the operating system, with accounts of its own."""
    return accounts.Machine(site)


@pytest.fixture
def server(site):
    return site.serve()


needs_root = pytest.mark.skipif(not harness.IS_ROOT, reason="needs root")
