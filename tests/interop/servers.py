"""The WebDAV servers that the project is tried on: each from its package, on a free loopback port, in a directory of its
own, with TLS and the users alice and bob. Nothing of the machine's own configuration is touched."""

import glob
import os
import shutil
import socket
import subprocess
import time

USERS = ("alice", "bob")
PASSWORD = "a long and private word"


class Missing(Exception):
    """Something that the server needs is not installed; the text names it."""


def free_port():
    with socket.socket() as probe:
        probe.bind(("127.0.0.1", 0))
        return probe.getsockname()[1]


def quiet(*command, **more):
    subprocess.run(command, check=True, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL, **more)


class Authority:
    """A certificate authority of this run, and a certificate for the loopback address."""

    def __init__(self, directory):
        self.ca, self.certificate, self.key = (os.path.join(directory, n) for n in ("ca.pem", "cert.pem", "key.pem"))
        ca_key, request, extensions = (os.path.join(directory, n) for n in ("ca.key", "request.pem", "ext.cnf"))
        quiet("openssl", "req", "-x509", "-newkey", "rsa:2048", "-nodes", "-days", "2", "-subj", "/CN=interop authority",
              "-keyout", ca_key, "-out", self.ca)
        quiet("openssl", "req", "-newkey", "rsa:2048", "-nodes", "-subj", "/CN=localhost", "-keyout", self.key,
              "-out", request)
        with open(extensions, "w") as out:
            out.write("subjectAltName=DNS:localhost,IP:127.0.0.1\n")
        quiet("openssl", "x509", "-req", "-in", request, "-CA", self.ca, "-CAkey", ca_key, "-CAcreateserial",
              "-days", "2", "-extfile", extensions, "-out", self.certificate)
        os.chmod(self.key, 0o644)  # of this run only, and some servers read it as another user


class Server:
    """Base: `configure` writes what the server needs and gives the commands that run it in the foreground."""

    name = ""
    packages = ()  # of Debian, whose versions are told; the first is the server's
    files = ()  # what has to be there
    access_lists = False
    environment = {}  # of the people who use it
    refusal = None  # of a server that cannot be used: the words by which a person is told, before anything is published
    absent = ""  # why it may be missing
    waits = False  # such a one may be somebody else's answer (a portal's), so a publication is noted and waits

    def __init__(self, directory, authority):
        self.directory, self.authority = directory, authority
        self.port, self.processes = free_port(), []
        self.root = os.path.join(directory, "root")
        self.user = "www-data" if os.getuid() == 0 else None
        os.makedirs(os.path.join(self.root, "dav"))
        os.makedirs(os.path.join(directory, "run"))
        self.passwords = self.file("passwords", "")
        for user in USERS:
            quiet("htpasswd", "-bm", self.passwords, user, PASSWORD)

    @property
    def endpoint(self):
        return f"https://127.0.0.1:{self.port}/dav/{{user}}/Contacts"

    def file(self, name, text):
        path = os.path.join(self.directory, name)
        with open(path, "w") as out:
            out.write(text)
        return path

    @classmethod
    def require(cls):
        for path in cls.files:
            if not (glob.glob(path) if path.startswith("/") else shutil.which(path, path=os.environ["PATH"] + ":/usr/sbin")):
                raise Missing(path)

    @classmethod
    def version(cls):
        told = []
        for package in cls.packages:
            asked = subprocess.run(["dpkg-query", "-W", "-f", "${Version}", package], capture_output=True, text=True)
            told.append(f"{package} {asked.stdout.strip() or 'not from a package'}")
        return ", ".join(told)

    def configure(self):
        raise NotImplementedError

    def own(self):
        if self.user:
            quiet("chown", "-R", f"{self.user}:", self.directory)

    def start(self):
        commands = self.configure()
        self.own()
        log = open(os.path.join(self.directory, "log"), "w")
        for command in commands:
            self.processes.append(subprocess.Popen(command, stdout=log, stderr=log, stdin=subprocess.DEVNULL,
                                                   cwd=self.directory, start_new_session=True))
        end = time.monotonic() + 20
        while True:
            try:
                self.listening()
                return
            except OSError:
                if time.monotonic() > end or any(p.poll() is not None for p in self.processes):
                    raise RuntimeError(f"{self.name} did not start: {self.words()}") from None
                time.sleep(0.05)

    def listening(self):
        """An OSError while the server does not listen yet."""
        socket.create_connection(("127.0.0.1", self.port), 1).close()

    def words(self):
        with open(os.path.join(self.directory, "log"), errors="replace") as log:
            return log.read()[-600:]

    def stop(self):
        for process in self.processes:
            process.terminate()
        for process in self.processes:
            try:
                process.wait(10)
            except subprocess.TimeoutExpired:
                process.kill()
                process.wait()


class Apache(Server):
    """Debian's apache2 with its own configuration, in a copy: what a2enmod would link is linked there."""

    name = "apache2 as shipped"
    packages = ("apache2",)
    files = ("/etc/apache2/apache2.conf", "a2enmod", "/usr/sbin/apache2")
    modules = ("dav", "dav_fs", "ssl")
    tls = True
    recipe = """
<Directory "{root}/dav">
    Dav On
    AllowOverride None
    Options None
    FileETag Digest
    AuthType Basic
    AuthName "Contacts"
    AuthBasicProvider file
    AuthUserFile "{passwords}"
    AuthzSendForbiddenOnFailure On
    Require valid-user
</Directory>
"""

    def configure(self):
        etc = os.path.join(self.directory, "etc")
        shutil.copytree("/etc/apache2", etc, symlinks=True)
        # What somebody has enabled on this machine is not what is shipped.
        shutil.rmtree(os.path.join(etc, "sites-enabled"))
        os.makedirs(os.path.join(etc, "sites-enabled"))
        encryption = f"""SSLEngine on
    SSLCertificateFile "{self.authority.certificate}"
    SSLCertificateKeyFile "{self.authority.key}\"""" if self.tls else ""
        environment = {**os.environ, "APACHE_CONFDIR": etc, "PATH": os.environ["PATH"] + ":/usr/sbin"}
        quiet("a2enmod", *self.modules, env=environment)
        self.file("etc/ports.conf", f"Listen 127.0.0.1:{self.port}\n")
        self.file("etc/sites-enabled/interop.conf", f"""
ServerName localhost
ServerRoot "{etc}"
DavLockDB "{self.directory}/run/DavLock"
<VirtualHost 127.0.0.1:{self.port}>
    DocumentRoot "{self.root}"
    {encryption}
    {self.recipe.format(root=self.root, passwords=self.passwords, directory=self.directory)}
</VirtualHost>
""")
        run = os.path.join(self.directory, "run")
        return [["env", f"APACHE_RUN_DIR={run}", f"APACHE_PID_FILE={run}/pid", f"APACHE_LOCK_DIR={run}",
                 f"APACHE_LOG_DIR={run}", f"APACHE_RUN_USER={self.user or os.environ.get('USER', 'nobody')}",
                 f"APACHE_RUN_GROUP={self.user or 'nogroup'}", "/usr/sbin/apache2", "-d", etc, "-f",
                 f"{etc}/apache2.conf", "-DFOREGROUND"]]


class ApacheWithLists(Apache):
    name = "apache2 as shipped, with mod_davacl"
    access_lists = True
    module = None  # the file, set by whoever knows the build

    @property
    def recipe(self):
        os.makedirs(os.path.join(self.directory, "lists"), mode=0o700, exist_ok=True)
        return """
    DavAclBase /dav "{directory}/lists"
    DavAclUserFile "{passwords}"
    <LocationMatch "^/(dav|principals)(/|$)">
        AuthType Basic
        AuthName "Contacts"
        AuthBasicProvider file
        AuthUserFile "{passwords}"
        AuthzSendForbiddenOnFailure On
        Require valid-user
    </LocationMatch>
    <Directory "{root}/dav">
        Dav On
        AllowOverride None
        Options None
        FileETag Digest
    </Directory>
"""

    def configure(self):
        commands = super().configure()
        self.file("etc/mods-enabled/davacl.load", f'LoadModule davacl_module "{self.module}"\n')
        return commands


class ApacheSqueezing(Apache):
    name = "apache2 with mod_deflate and mod_http2"
    modules = ("dav", "dav_fs", "ssl", "deflate", "http2")
    environment = {"ROLVANE_HTTP2": "always"}
    recipe = Apache.recipe + """
    Protocols h2 http/1.1
    SetOutputFilter DEFLATE
"""


class ApacheCompressing(Apache):
    """Every body comes compressed, whether it was asked for or not: proxies do that. The tag stays that of the file."""

    name = "apache2 that compresses unasked"
    modules = ("dav", "dav_fs", "ssl", "deflate", "headers")
    recipe = Apache.recipe + """
    RequestHeader set Accept-Encoding gzip early
    SetOutputFilter DEFLATE
    DeflateAlterETag NoChange
"""


class Nginx(Server):
    name = "nginx with dav-ext"
    packages = ("nginx", "libnginx-mod-http-dav-ext")
    files = ("/usr/sbin/nginx", "/usr/lib/nginx/modules/ngx_http_dav_ext_module.so")
    modules = "load_module /usr/lib/nginx/modules/ngx_http_dav_ext_module.so;"
    zones = "dav_ext_lock_zone zone=contacts:10m;"

    def location(self):
        return f"""
            location /dav/ {{
                dav_methods PUT DELETE MKCOL COPY MOVE;
                dav_ext_methods PROPFIND OPTIONS LOCK UNLOCK;
                dav_ext_lock zone=contacts;
                client_max_body_size 100m;
            }}"""

    def configure(self):
        run = os.path.join(self.directory, "run")
        user = f"user {self.user};" if self.user else ""
        temporary = "".join(f"{kind}_temp_path {run}/{kind};\n" for kind in
                            ("client_body", "proxy", "fastcgi", "uwsgi", "scgi"))
        self.file("nginx.conf", f"""
{self.modules}
{user}
daemon off;
pid {run}/pid;
error_log {run}/error.log;
events {{}}
http {{
    access_log off;
    {temporary}
    {self.zones}
    server {{
        listen 127.0.0.1:{self.port} ssl;
        ssl_certificate {self.authority.certificate};
        ssl_certificate_key {self.authority.key};
        root {self.root};
        auth_basic Contacts;
        auth_basic_user_file {self.passwords};
        {self.location()}
    }}
}}
""")
        return [["/usr/sbin/nginx", "-c", f"{self.directory}/nginx.conf", "-e", f"{run}/error.log"]]


class NginxPlain(Nginx):
    """What its package can by itself: files and folders, and neither PROPFIND nor OPTIONS."""

    name = "nginx without dav-ext"
    packages = ("nginx",)
    files = ("/usr/sbin/nginx",)
    modules = zones = ""
    refusal = "is no WebDAV server"
    waits = True

    def location(self):
        return """
            location /dav/ {
                dav_methods PUT DELETE MKCOL COPY MOVE;
                client_max_body_size 100m;
            }"""


class NginxFolderless(Nginx):
    """With the extension, and without MKCOL, as in many a recipe."""

    name = "nginx with dav-ext, MKCOL not allowed"
    refusal = "makes no folders"

    def location(self):
        return super().location().replace("MKCOL ", "")


class Lighttpd(Server):
    name = "lighttpd"
    packages = ("lighttpd", "lighttpd-mod-webdav")
    files = ("/usr/sbin/lighttpd", "/usr/lib/lighttpd/mod_webdav.so", "/usr/lib/lighttpd/mod_openssl.so")

    def configure(self):
        user = f'server.username = "{self.user}"\nserver.groupname = "{self.user}"\n' if self.user else ""
        path = self.file("lighttpd.conf", f"""
server.modules = ("mod_auth", "mod_authn_file", "mod_openssl", "mod_webdav")
server.document-root = "{self.root}"
server.bind = "127.0.0.1"
server.port = {self.port}
{user}
ssl.engine = "enable"
ssl.pemfile = "{self.authority.certificate}"
ssl.privkey = "{self.authority.key}"
auth.backend = "htpasswd"
auth.backend.htpasswd.userfile = "{self.passwords}"
$HTTP["url"] =~ "^/dav(/|$)" {{
    webdav.activate = "enable"
    webdav.sqlite-db-name = "{self.directory}/run/locks.db"
    auth.require = ("" => ("method" => "basic", "realm" => "Contacts", "require" => "valid-user"))
}}
""")
        return [["/usr/sbin/lighttpd", "-D", "-f", path]]


class Rclone(Server):
    name = "rclone serve webdav"
    packages = ("rclone",)
    files = ("rclone",)

    def configure(self):
        return [["rclone", "serve", "webdav", self.root, "--config", os.path.join(self.directory, "rclone.conf"),
                 "--cache-dir", os.path.join(self.directory, "run"), "--addr", f"127.0.0.1:{self.port}",
                 "--cert", self.authority.certificate, "--key", self.authority.key, "--htpasswd", self.passwords]]


class Behind(Nginx):
    """A server that speaks plain http, behind nginx, which ends TLS and asks for the password."""

    modules = zones = ""

    def __init__(self, directory, authority):
        super().__init__(directory, authority)
        self.inner = free_port()

    def listening(self):
        super().listening()
        socket.create_connection(("127.0.0.1", self.inner), 1).close()

    def location(self):
        return f"""
            location / {{
                proxy_pass http://127.0.0.1:{self.inner};
                proxy_http_version 1.1;
                client_max_body_size 100m;
            }}"""


class ApacheBehind(Behind):
    """Speaks plain http, knows nothing of TLS, and calls itself by its inner address."""

    name = "apache2 with mod_davacl, behind nginx"
    packages = ("apache2", "nginx")
    files = ("/usr/sbin/nginx", *Apache.files)
    access_lists = True

    def configure(self):
        place = os.path.join(self.directory, "apache")
        os.makedirs(place)
        apache = ApacheWithLists(place, self.authority)
        apache.tls, apache.port, apache.root, apache.passwords = False, self.inner, self.root, self.passwords
        return apache.configure() + super().configure()


class Sabre(Behind):
    name = "PHP (php-sabre-dav by php-fpm, behind nginx)"
    packages = ("php-sabre-dav", "php8.2-fpm", "nginx")
    files = ("/usr/sbin/nginx", "/usr/share/php/Sabre/DAV/Server.php", "/usr/sbin/php-fpm*")

    def listening(self):
        Nginx.listening(self)
        os.stat(os.path.join(self.directory, "run/php.sock"))

    def location(self):
        return f"""
            location / {{
                fastcgi_pass unix:{self.directory}/run/php.sock;
                include /etc/nginx/fastcgi_params;
                fastcgi_param SCRIPT_FILENAME {self.directory}/server.php;
                client_max_body_size 100m;
            }}"""

    def configure(self):
        self.file("server.php", f"""<?php
error_reporting(0);
spl_autoload_register(function ($class) {{
    $file = '/usr/share/php/' . str_replace('\\\\', '/', $class) . '.php';
    if (file_exists($file)) include $file;
}});
$server = new Sabre\\DAV\\Server(new Sabre\\DAV\\FS\\Directory('{self.root}'));
$server->setBaseUri('/');
$server->addPlugin(new Sabre\\DAV\\Locks\\Plugin(new Sabre\\DAV\\Locks\\Backend\\File('{self.directory}/run/locks')));
$server->exec();
""")
        user = f"user = {self.user}\ngroup = {self.user}\nlisten.owner = {self.user}" if self.user else ""
        path = self.file("fpm.conf", f"""
[global]
error_log = {self.directory}/run/fpm.log
daemonize = no
[www]
{user}
listen = {self.directory}/run/php.sock
pm = static
pm.max_children = 4
""")
        return [[sorted(glob.glob("/usr/sbin/php-fpm*"))[-1], "-F", "-y", path]] + super().configure()


class PyWebDAV(Behind):
    """Its LOCK fails in the middle of the answer (a status that is a text), and the lock stands for ever."""

    name = "python3-webdav, behind nginx"
    packages = ("python3-webdav", "nginx")
    files = ("/usr/sbin/nginx", "davserver3")
    options = ()
    refusal = "locks files and does not tell their locks"

    def configure(self):
        return [["davserver3", "-D", self.root, "-H", "127.0.0.1", "-P", str(self.inner), "-n",
                 *self.options]] + super().configure()


class PyWebDAVLockless(PyWebDAV):
    name = "python3-webdav with --nolock, behind nginx"
    options = ("--nolock",)
    refusal = None


class Radicale(Server):
    """A server for address books and calendars: it takes files of no other kind."""

    name = "Radicale"
    packages = ("radicale",)
    files = ("radicale",)
    refusal = "takes no files of this kind"

    @property
    def endpoint(self):
        return f"https://127.0.0.1:{self.port}/{{user}}/Contacts"

    def configure(self):
        path = self.file("radicale.conf", f"""
[server]
hosts = 127.0.0.1:{self.port}
ssl = True
certificate = {self.authority.certificate}
key = {self.authority.key}
[auth]
type = htpasswd
htpasswd_filename = {self.plain_passwords()}
htpasswd_encryption = plain
delay = 0
[rights]
type = authenticated
[storage]
filesystem_folder = {self.root}
""")
        return [["radicale", "--config", path]]

    def plain_passwords(self):
        return self.file("plain-passwords", "".join(f"{user}:{PASSWORD}\n" for user in USERS))


class Chezdav(Behind):
    name = "chezdav (libphodav), behind nginx"
    packages = ("chezdav", "nginx")
    files = ("/usr/sbin/nginx", "chezdav")

    def configure(self):
        return [["chezdav", "--no-mdns", "-p", str(self.inner), "-P", self.root]] + super().configure()


class Npm(Server):
    """A server of the npm registry. What it needs is installed into `modules`, outside of the repository."""

    files = ("node", "npm")
    modules = None  # the directory, set by whoever installs
    npm = ()
    script = ""

    @classmethod
    def require(cls):
        super().require()
        if not cls.modules:
            raise Missing(f"npm install {' '.join(cls.npm)}")

    @classmethod
    def version(cls):
        told = []
        for package in cls.npm[:1]:
            asked = subprocess.run(["node", "-p", f"require('{cls.modules}/node_modules/{package}/package.json').version"],
                                   capture_output=True, text=True)
            told.append(f"{package} {asked.stdout.strip()}")
        return ", ".join(told) + " (npm)"

    def own(self):
        pass  # it runs as whoever has started it

    def configure(self):
        os.symlink(os.path.join(self.modules, "node_modules"), os.path.join(self.directory, "node_modules"))
        script = self.script
        for key, value in {"ROOT": self.root, "PORT": self.port, "CERT": self.authority.certificate,
                           "KEY": self.authority.key, "PASSWORD": PASSWORD}.items():
            script = script.replace(f"@{key}@", str(value))
        return [["node", self.file("server.mjs", script)]]


class NpmWebdavServer(Npm):
    name = "webdav-server (npm)"
    npm = ("webdav-server",)
    script = """
import { readFileSync } from 'node:fs';
import pkg from 'webdav-server';
const { v2: webdav } = pkg;
const users = new webdav.SimpleUserManager();
const rights = new webdav.SimplePathPrivilegeManager();
for (const name of ['alice', 'bob']) rights.setRights(users.addUser(name, '@PASSWORD@', false), '/', ['all']);
const server = new webdav.WebDAVServer({
    port: @PORT@, hostname: '127.0.0.1', requireAuthentification: true,
    httpAuthentication: new webdav.HTTPBasicAuthentication(users, 'Contacts'), privilegeManager: rights,
    https: { cert: readFileSync('@CERT@'), key: readFileSync('@KEY@') } });
await server.setFileSystemAsync('/', new webdav.PhysicalFileSystem('@ROOT@'));
server.start(() => {});
"""


class Nephele(Npm):
    name = "nephele (npm)"
    npm = ("nephele", "@nephele/adapter-file-system", "@nephele/authenticator-none", "express")
    script = """
import https from 'node:https';
import { readFileSync } from 'node:fs';
import express from 'express';
import nephele from 'nephele';
import FileSystem from '@nephele/adapter-file-system';
import None from '@nephele/authenticator-none';
const app = express();
const known = new Set(['alice', 'bob'].map((name) => 'Basic ' + Buffer.from(name + ':@PASSWORD@').toString('base64')));
app.use((request, response, next) => known.has(request.headers.authorization) ? next()
    : response.status(401).set('WWW-Authenticate', 'Basic realm="Contacts"').end());
app.use('/', nephele({ adapter: new (FileSystem.default ?? FileSystem)({ root: '@ROOT@' }),
    authenticator: new (None.default ?? None)() }));
https.createServer({ cert: readFileSync('@CERT@'), key: readFileSync('@KEY@') }, app).listen(@PORT@, '127.0.0.1');
"""


class Wsgidav(Server):
    """Not among the distribution's packages: tried where somebody has installed it."""

    name = "wsgidav"
    files = ("wsgidav",)
    absent = "; Debian 12 has no package of it"

    @classmethod
    def version(cls):
        return "wsgidav " + subprocess.run(["wsgidav", "--version"], capture_output=True, text=True).stdout.strip()

    def configure(self):
        users = "".join(f'      "{user}": {{password: "{PASSWORD}"}}\n' for user in USERS)
        path = self.file("wsgidav.yaml", f"""
host: 127.0.0.1
port: {self.port}
server: cheroot
ssl_certificate: "{self.authority.certificate}"
ssl_private_key: "{self.authority.key}"
provider_mapping:
  "/": "{self.root}"
lock_storage: true
simple_dc:
  user_mapping:
    "*":
{users}
""")
        return [["wsgidav", "--config", path]]


ALL = (Apache, ApacheWithLists, ApacheBehind, ApacheSqueezing, ApacheCompressing, Nginx, NginxPlain, NginxFolderless, Lighttpd, Rclone, Sabre, PyWebDAV,
       PyWebDAVLockless, Radicale, Chezdav, NpmWebdavServer, Nephele, Wsgidav)
