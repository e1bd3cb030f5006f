"""What is asked of the servers. A new scenario is one more entry of SCENARIOS."""

import base64
import hashlib
from collections.abc import Callable
from dataclasses import dataclass, field
from pathlib import Path

KB = 1024
MB = 1024 * KB


@dataclass(frozen=True)
class Scenario:
    name: str
    title: str
    path: str  # of the URL
    size: int  # bytes of a good reply's body; every other length counts as a failure
    prepare: Callable[["Scenario", Path], None]  # fills the web root that all servers share
    stretch: int = 1  # times the seconds of a cell: slow replies need longer runs for the same number of requests
    ab_options: list[str] = field(default_factory=list)  # say, ["-A", "user:password"]
    # Lines added to a server's configuration, by the server's name; see Server.configure for where they go. @ROOT@ is
    # the web root.
    extra_config: dict[str, str] = field(default_factory=dict)
    only: frozenset[str] | None = None  # the servers that can answer it; None: all

    def serves(self, server_name: str) -> bool:
        return self.only is None or server_name in self.only


def page(scenario: Scenario, root: Path) -> None:
    """An HTML page of the scenario's size, filled up with text."""
    head = b"<html><head><title>Report</title></head><body>\n"
    tail = b"\n</body></html>\n"
    line = b"<p>The quick brown fox jumps over the lazy dog 0123456789.</p>\n"
    room = scenario.size - len(head) - len(tail)
    body = (line * (room // len(line) + 1))[:room]
    (root / scenario.path.lstrip("/")).write_bytes(head + body + tail)


USER, PASSWORD = "bench", "mark"

# What all servers run: the headers are for those that hand a script's output on as it is.
HELLO = """\
use strict;
print "Content-Type: text/html\\r\\n\\r\\n" if $ENV{GATEWAY_INTERFACE};
print "<html><body>Hello, world: 0123456789</body></html>\\n";
"""
HELLO_SIZE = 51
# The smallest scripting engine that can run it: the page goes to the file that the server names. Its end is the end of
# the conversation. It is started by its first line, as the script is by the other servers.
ENGINE = """\
#!/usr/bin/perl
open STDOUT, '>>', $ARGV[3] or die $!;
do $ARGV[1];
"""


def script(scenario: Scenario, root: Path) -> None:
    for path, text in ((root / scenario.path.lstrip("/"), f"#!/usr/bin/perl\n{HELLO}"),
                       (root.parent / "ox_script.bin", ENGINE)):
        path.write_text(text)
        path.chmod(0o755)


def page_behind_login(scenario: Scenario, root: Path) -> None:
    """The page in a directory of its own, and the one user in every server's form: a hash that costs them little."""
    (root / scenario.path.lstrip("/")).parent.mkdir()
    page(scenario, root)
    digest = base64.b64encode(hashlib.sha1(PASSWORD.encode()).digest()).decode()
    (root.parent / "htpasswd").write_text(f"{USER}:{{SHA}}{digest}\n")
    users = root.parent / "oxm_oxx" / "datfiles" / "users"
    users.mkdir(parents=True)
    (users / f"{USER}.usr").write_text(f"[UserInfo]\nusername={USER}\nPlaintextPassword={PASSWORD}\npermissions=0\n")


SCENARIOS = [
    Scenario("1k", "1 KB file", "/1k.html", 1 * KB, page),
    Scenario("100k", "100 KB file", "/100k.html", 100 * KB, page),
    Scenario("10m", "10 MB file", "/10m.html", 10 * MB, page, stretch=2),
    Scenario("script", "hello-world Perl script", "/hello.pl", HELLO_SIZE, script, only=frozenset(
        {"ox_remote", "lighttpd", "apache"}), extra_config={
            "lighttpd": 'server.modules += ( "mod_cgi" )\ncgi.assign = ( ".pl" => "" )\n'
                        'static-file.exclude-extensions = ( ".pl" )',
            "apache": "LoadModule cgid_module /usr/lib/apache2/modules/mod_cgid.so\nScriptSock cgisock\n"
                      "AddHandler cgi-script .pl\n<Directory @ROOT@>\nOptions +ExecCGI\n</Directory>"}),
    Scenario("login", "1 KB file behind a login", "/private/1k.html", 1 * KB, page_behind_login,
             ab_options=["-A", f"{USER}:{PASSWORD}"], extra_config={
                 "nginx": "location /private/ { auth_basic private; auth_basic_user_file @ROOT@/../htpasswd; }",
                 "lighttpd": 'server.modules += ( "mod_auth", "mod_authn_file" )\n'
                             'auth.backend = "htpasswd"\nauth.backend.htpasswd.userfile = "@ROOT@/../htpasswd"\n'
                             'auth.require = ( "/private/" => ( "method" => "basic", "realm" => "private", '
                             '"require" => "valid-user" ) )',
                 "apache": "".join(f"LoadModule {name}_module /usr/lib/apache2/modules/mod_{name}.so\n" for name in
                                   ("auth_basic", "authn_core", "authn_file", "authz_user")) +
                           "<Directory @ROOT@/private>\nAuthType Basic\nAuthName private\n"
                           "AuthUserFile @ROOT@/../htpasswd\nRequire valid-user\n</Directory>"}),
]
