"""Real programs on data that is made for them: each of PROGRAMS starts one in a folder of its own and returns when it is warm.

A function gets the folder, which belongs to the user nobody, and returns the process that the program descends from.
What it starts besides, such as clients, is ended with it by whoever called.
"""
import glob, json, os, random, shutil, socket, subprocess, time, urllib.request

USER = ["setpriv", "--reuid=nobody", "--regid=nogroup", "--clear-groups"] if os.geteuid() == 0 else []
PATIENCE = 120  # seconds


def environment(folder):
    return {"PATH": os.environ["PATH"], "HOME": folder, "TMPDIR": folder, "LANG": "C.UTF-8"}


def start(folder, command, **options):
    """A program in the background, with what it says in a file."""
    log = open(os.path.join(folder, "log"), "a")
    options = {"stdin": subprocess.DEVNULL, "stdout": log, "stderr": log, **options}
    return subprocess.Popen(USER + command, cwd=folder, env=environment(folder), **options)


def do(folder, command, text=None):
    return subprocess.run(USER + command, cwd=folder, env=environment(folder), input=text, check=True, text=True,
                          stdout=subprocess.PIPE, stderr=subprocess.STDOUT, timeout=PATIENCE).stdout


def write(folder, name, text):
    path = os.path.join(folder, name)
    with open(path, "w") as file:
        file.write(text)
    return path


def wait_for(what, is_there, process):
    end = time.monotonic() + PATIENCE
    while time.monotonic() < end:
        if process.poll() is not None:
            raise SystemExit("it ended while waited for %s: exit status %d" % (what, process.returncode))
        try:
            if is_there():
                return
        except (OSError, ValueError, subprocess.CalledProcessError):
            pass  # not yet
        time.sleep(0.1)
    raise SystemExit("waited %d s in vain for %s" % (PATIENCE, what))


def wait_for_line(folder, process, line="ready"):
    def is_there():
        with open(os.path.join(folder, "log")) as file:
            return line in file.read()
    wait_for("the line '%s'" % line, is_there, process)


PAGE = """<!doctype html><title>loading</title><canvas id=c width=1600 height=1200></canvas><script>
const context = document.getElementById('c').getContext('2d');
for (let i = 0; i < 4000; ++i) {
  context.fillStyle = `hsl(${i % 360} 80% 50%)`;
  context.fillRect(i * 7 % 1600, i * 13 % 1200, 40, 40);
}
window.objects = Array.from({length: 2000000}, (_, i) => ({name: 'object ' + i % 1000, number: i, next: null}));
for (let i = 1; i < objects.length; ++i) objects[i].next = objects[i - 1];
document.title = 'ready';
</script>"""


def browser(folder):
    page, profile = write(folder, "page.html", PAGE), os.path.join(folder, "profile")
    process = start(folder, ["chromium", "--headless=new", "--no-sandbox", "--disable-gpu", "--disable-breakpad",
                             "--no-first-run", "--disable-background-networking", "--disable-component-update",
                             "--user-data-dir=" + profile, "--remote-debugging-port=0", "file://" + page])

    def is_loaded():
        with open(os.path.join(profile, "DevToolsActivePort")) as file:
            port = int(file.readline())
        with urllib.request.urlopen("http://127.0.0.1:%d/json/list" % port, timeout=5) as answer:
            return any(tab.get("title") == "ready" for tab in json.load(answer))
    wait_for("the page", is_loaded, process)
    return process


def postgresql(folder):
    programs = sorted(glob.glob("/usr/lib/postgresql/*/bin"))[-1] + "/"
    data = os.path.join(folder, "data")
    do(folder, [programs + "initdb", "-D", data, "-U", "nobody", "--no-sync"])
    server = start(folder, [programs + "postgres", "-D", data, "-k", folder, "-c", "listen_addresses=",
                            "-c", "shared_buffers=128MB", "-c", "fsync=off"])
    client = ["-h", folder, "-U", "nobody"]
    wait_for("the server", lambda: do(folder, [programs + "pg_isready"] + client), server)
    do(folder, [programs + "createdb"] + client + ["bench"])
    do(folder, [programs + "pgbench"] + client + ["-i", "-q", "-s", "10", "bench"])
    start(folder, [programs + "pgbench"] + client + ["-n", "-c", "20", "-T", "300", "bench"])
    time.sleep(5)
    return server


def redis(folder):
    port = os.path.join(folder, "redis.sock")
    # A save that is slowed down, so that it does not end before it is looked at.
    server = start(folder, ["redis-server", "--port", "0", "--unixsocket", port, "--dir", folder, "--save", "",
                            "--enable-debug-command", "local", "--rdb-key-save-delay", "200"])
    client = ["redis-cli", "-s", port]
    wait_for("the server", lambda: "PONG" in do(folder, client + ["ping"]), server)
    do(folder, client + ["debug", "populate", "500000", "key", "200"])
    do(folder, client + ["bgsave"])
    do(folder, ["redis-benchmark", "-s", port, "-q", "-t", "set", "-r", "200000", "-n", "100000", "-d", "200"])
    if "rdb_bgsave_in_progress:1" not in do(folder, client + ["info", "persistence"]):
        raise SystemExit("the background save has ended already")
    return server


NGINX = """daemon off; worker_processes 8; pid nginx.pid; error_log error.log;
events { worker_connections 512; }
http {
  access_log off; client_body_temp_path b; proxy_temp_path p; fastcgi_temp_path f; uwsgi_temp_path u; scgi_temp_path s;
  limit_req_zone $arg_who zone=visitors:16m rate=1000r/s;
  server { listen unix:nginx.sock; root .; location / { limit_req zone=visitors burst=100; } }
}"""


def nginx(folder):
    configuration = write(folder, "nginx.conf", NGINX.replace("unix:", "unix:%s/" % folder).replace("root .", "root " + folder))
    write(folder, "index.html", "<p>page</p>" * 1000)
    server = start(folder, ["nginx", "-p", folder, "-e", "error.log", "-c", configuration])
    port = os.path.join(folder, "nginx.sock")

    def get(who):
        with socket.socket(socket.AF_UNIX) as client:
            client.connect(port)
            client.sendall(b"GET /?who=%d HTTP/1.0\r\n\r\n" % who)
            while client.recv(65536):
                pass
        return True
    wait_for("the server", lambda: get(0), server)
    for who in range(4000):
        get(who)
    return server


def mariadb(folder):
    data, port = os.path.join(folder, "data"), os.path.join(folder, "mariadb.sock")
    do(folder, ["mariadb-install-db", "--no-defaults", "--datadir=" + data, "--auth-root-authentication-method=normal"])
    server = start(folder, ["mariadbd", "--no-defaults", "--datadir=" + data, "--socket=" + port, "--skip-networking"])
    client = ["mariadb", "--no-defaults", "--socket=" + port, "-u", "root"]
    wait_for("the server", lambda: do(folder, client, "select 1"), server)
    do(folder, client, "create database bench; use bench; create table t (id int primary key, k int, text char(120), key (k));"
                       "insert into t select seq, seq * 7919 % 100003, md5(seq) from seq_1_to_400000;"
                       "select count(distinct text) from t where k % 3 = 1;")
    for _ in range(10):
        session = start(folder, client + ["-n", "bench"], stdin=subprocess.PIPE, text=True)
        session.stdin.write("select count(*), max(text) from t where k < 50000; select sleep(300);\n")
        session.stdin.flush()
    time.sleep(3)
    return server


def php(folder):
    port = os.path.join(folder, "php.sock")
    configuration = write(folder, "fpm.conf", "[global]\ndaemonize = no\nerror_log = %s/fpm.log\npid = %s/fpm.pid\n"
                          "[www]\nlisten = %s\npm = static\npm.max_children = 12\n" % (folder, folder, port))
    script = write(folder, "page.php", "<?php $a = []; for ($i = 0; $i < 60000; ++$i) $a[] = ['id' => $i, 'text' => md5((string)$i)];"
                                       "usort($a, fn($x, $y) => $x['text'] <=> $y['text']); echo count($a), 'rows';")
    program = (glob.glob("/usr/sbin/php-fpm*") or ["php-fpm"])[0]
    server = start(folder, [program, "--nodaemonize", "--fpm-config", configuration, "-d", "opcache.enable=1"])

    def ask(_=0):
        command = ["env", "SCRIPT_FILENAME=" + script, "REQUEST_METHOD=GET", "cgi-fcgi", "-bind", "-connect", port]
        return "60000rows" in do(folder, command)
    wait_for("the pool", ask, server)
    for _ in range(60):
        ask()
    return server


JAVA = """import java.util.*;
public class Main {
    static Map<Integer, byte[]> kept = new HashMap<>();
    public static void main(String[] arguments) throws Exception {
        for (int i = 0; i < 100000; ++i) kept.put(i, new byte[1000]);
        for (int i = 0; i < 60; ++i) {
            Thread thread = new Thread(() -> {
                List<String> mine = new ArrayList<>();
                for (int k = 0; k < 5000; ++k) mine.add("text " + k);
                try { Thread.sleep(600000); } catch (InterruptedException e) { }
                System.out.println(mine.size());
            });
            thread.setDaemon(true);
            thread.start();
        }
        Thread.sleep(2000);
        System.out.println("ready");
        Thread.sleep(600000);
    }
}"""


def java(folder):
    return ready(folder, ["java", "-Xmx512m", write(folder, "Main.java", JAVA)])


def ready(folder, command, **options):
    process = start(folder, command, **options)
    wait_for_line(folder, process)
    return process


NODE = """const {Worker, isMainThread} = require('worker_threads');
const kept = Array.from({length: isMainThread ? 1000000 : 50000}, (_, i) => ({i, text: 'text ' + i}));
if (isMainThread) { for (let i = 0; i < 4; ++i) new Worker(__filename); setTimeout(() => console.log('ready'), 3000); }
setTimeout(() => kept.length, 600000);"""


def node(folder):
    return ready(folder, ["node", write(folder, "main.js", NODE)])


ERLANG = """T = ets:new(t, [public]),
[ets:insert(T, {N, integer_to_binary(N), lists:seq(1, 10)}) || N <- lists:seq(1, 300000)],
[spawn(fun() -> L = lists:seq(1, 100), receive stop -> L end end) || _ <- lists:seq(1, 20000)],
io:format("ready~n"), timer:sleep(600000)."""


def erlang(folder):
    return ready(folder, ["erl", "-noshell", "-noinput", "-eval", ERLANG])


GO = """package main

import ("fmt"; "time")

func main() {
	kept := map[int][]byte{}
	for i := 0; i < 100000; i++ {
		kept[i] = make([]byte, 1000)
		kept[i][i%1000] = 1
	}
	for i := 0; i < 2000; i++ {
		go func() { var mine [4096]byte; mine[i%4096] = 1; time.Sleep(time.Hour); fmt.Println(mine) }()
	}
	time.Sleep(time.Second)
	fmt.Println("ready")
	time.Sleep(10 * time.Minute)
	fmt.Println(len(kept))
}"""


def go(folder):
    do(folder, ["env", "GOFLAGS=-mod=mod", "GO111MODULE=off", "go", "build", "-o", "program", write(folder, "main.go", GO)])
    return ready(folder, [os.path.join(folder, "program")])


def compiler(folder):
    functions = "".join("template <int N> struct S%d { std::map<std::string, std::vector<int>> m; int f(int x) "
                        "{ m[std::to_string(x)].push_back(N); return x * %d + static_cast<int>(m.size()); } };\n"
                        "int g%d(int x) { return S%d<%d>{}.f(x); }\n" % (i, i, i, i, i) for i in range(3000))
    write(folder, "big.cpp", "#include <map>\n#include <string>\n#include <vector>\n" + functions)
    process = start(folder, ["g++", "-O2", "-c", "big.cpp", "-o", "big.o"])
    time.sleep(8)
    if process.poll() is not None:
        raise SystemExit("the compiler has ended already")
    return process


PROGRAMS = {each.__name__: each for each in
            (browser, postgresql, redis, nginx, mariadb, php, java, node, erlang, go, compiler)}
