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
    """The tests that mostly wait come first, so that they overlap with the busy ones in a parallel run."""
    for item in items:
        if item.get_closest_marker("soak") and os.environ.get("OX_SOAK") != "1":
            item.add_marker(pytest.mark.skip(reason="long load run: set OX_SOAK=1"))

    def rank(item):
        if item.get_closest_marker("slow"):
            return 0
        return 1 if item.get_closest_marker("daemon") else 2

    items.sort(key=rank)


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
