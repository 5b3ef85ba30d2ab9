"""quarn-device cloud-check: one line that tells what to look at, and quarnctl's words for it."""
import json
import os
import secrets
import ssl
import subprocess
import sys
import unittest

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
from quarn_test import AnsweringServer, TestCase, free_ports, make_source  # noqa: E402

# Words of chance: what other processes of the machine show may hold any word that means something.
PASSWORD = secrets.token_hex(8) + " " + secrets.token_hex(8)
OK_LINE = "ok: objects can be put there, read and removed\n"


class CloudCheck(TestCase):
    def setUp(self):
        self.device = self.new_device(serial="350000000000017", account="ada")

    def set_cloud(self, url, *options):
        self.device.call("set", "cloud", url, "--user", "ada", *options, input=PASSWORD + "\n")

    def check(self, *options):
        result = self.device.call("cloud-check", *options, check=False)
        self.assertNotIn(PASSWORD, result.stdout + result.stderr)
        return result.returncode, result.stdout, result.stderr

    def answer_of(self, status, reason):
        with AnsweringServer(status, reason) as server:
            self.set_cloud("webdav+http://127.0.0.1:%d/dav" % server.port)
            return self.check()

    def test_a_folder_that_can_be_used_and_holds_nothing_of_the_check_afterwards(self):
        self.assertEqual(self.check(), (0, OK_LINE, ""))
        self.assertEqual(os.listdir(self.device.cloud), [])

    def test_a_refused_connection_is_the_network(self):
        port, = free_ports(1)
        self.set_cloud("webdav+http://127.0.0.1:%d/" % port)
        code, out, error = self.check()
        self.assertEqual((code, out), (15, ""))
        self.assertRegex(error, r"^network: Failed to connect to 127\.0\.0\.1 port %d .*\n$" % port)

    def test_a_host_that_does_not_exist_is_the_address(self):
        self.set_cloud("webdav+https://no-such-host.invalid/dav")
        self.assertEqual(self.check(),
                         (11, "", "address: Could not resolve host: no-such-host.invalid\n"))

    def test_a_server_of_another_kind_is_the_address(self):
        self.assertEqual(self.answer_of(501, "Not Implemented"), (
            11, "", "address: list: the server answered 501 (Not Implemented)\n"))

    def test_a_page_for_people_is_the_address(self):
        with AnsweringServer(200, "OK") as server:
            for kind in ("webdav", "s3"):
                self.set_cloud("%s+http://127.0.0.1:%d/dav" % (kind, server.port))
                self.assertEqual(self.check(), (
                    11, "", "address: list: the server's answer is not a listing\n"))

    def test_a_server_that_sends_elsewhere_is_the_address(self):
        code, out, error = self.answer_of(301, "Moved Permanently")
        self.assertEqual((code, out), (11, ""))
        self.assertRegex(error, r"^address: .*: the server answered 301 \(Moved Permanently\)\n$")

    def test_refused_credentials_are_the_password(self):
        self.assertEqual(self.answer_of(401, "Unauthorized"), (
            13, "", "password: list: the server answered 401 (Unauthorized)\n"))

    def test_a_full_store_is_the_space(self):
        self.assertEqual(self.answer_of(507, "Insufficient Storage"), (
            14, "", "space: list: the server answered 507 (Insufficient Storage)\n"))

    def test_a_broken_server_is_the_server_and_what_it_says_is_made_printable(self):
        self.assertEqual(self.answer_of(500, "\x1b[31mOops"), (
            16, "", "server: list: the server answered 500 (?[31mOops)\n"))

    def tls(self):
        certificate, key = self.path("cert.pem"), self.path("key.pem")
        subprocess.run(["openssl", "req", "-x509", "-newkey", "rsa:2048", "-nodes", "-days", "2",
                        "-subj", "/CN=localhost", "-addext", "subjectAltName=IP:127.0.0.1",
                        "-keyout", key, "-out", certificate], check=True,
                       stderr=subprocess.DEVNULL)
        context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
        context.load_cert_chain(certificate, key)
        return context, certificate

    def test_a_certificate_that_nobody_vouches_for_is_the_certificate(self):
        context, _certificate = self.tls()
        with AnsweringServer(507, "Insufficient Storage", context) as server:
            self.set_cloud("webdav+https://127.0.0.1:%d/dav" % server.port)
            code, out, error = self.check()
        self.assertEqual((code, out), (12, ""))
        self.assertRegex(error, "^certificate: .*\n$")

    def test_a_ca_file_vouches_for_it(self):
        context, certificate = self.tls()
        with AnsweringServer(507, "Insufficient Storage", context) as server:
            self.set_cloud("webdav+https://127.0.0.1:%d/dav" % server.port, "--ca-file",
                           certificate)
            self.assertEqual(self.check()[0], 14)

    def test_a_configuration_that_cannot_be_used_is_the_device(self):
        self.set_cloud("webdav+https://example.invalid/dav")
        config = os.path.join(self.device.path, "state/cloud.conf")
        os.chmod(config, 0o644)
        self.assertEqual(self.check(), (
            17, "", "device: %s: holds a password and is not of mode 0600\n" % config))

    def test_the_document_for_programs(self):
        code, out, error = self.check("--json")
        self.assertEqual((code, error), (0, ""))
        self.assertEqual(json.loads(out), {
            "verb": "cloud-check", "cause": "ok", "error": 0,
            "message": "objects can be put there, read and removed"})
        with AnsweringServer(401, "Unauthorized") as server:
            self.set_cloud("webdav+http://127.0.0.1:%d/dav" % server.port)
            code, out, error = self.check("--json")
        self.assertEqual((code, error), (13, ""))
        self.assertEqual(json.loads(out), {
            "verb": "cloud-check", "cause": "password", "error": 10,
            "message": "list: the server answered 401 (Unauthorized)"})

    def test_wrong_words_are_refused(self):
        for options in (("--jason",), ("--json", "more")):
            self.assertEqual(self.check(*options)[0], 64)

    def test_quarnctl_has_words_for_it(self):
        self.device.set("network", "wifi")
        with AnsweringServer(401, "Unauthorized") as server:
            self.set_cloud("webdav+http://127.0.0.1:%d/dav" % server.port)
            self.device.start()
            self.device.install(make_source(self.path("source"), "org.example.notes", "1.0",
                                            {"data/file": b"text"}))
            result = self.device.quarnctl("backup", check=False)
            listed = self.device.quarnctl("list", check=False)
            status = json.loads(self.device.quarnctl("status", "--json").stdout)
        self.assertIn("the cloud refused the user name or password\n", result.stderr)
        self.assertIn("the cloud refused the user name or password\n", listed.stderr)
        self.assertEqual(status["cloud_problem"], "password")
        for text in (result.stdout, result.stderr, listed.stderr, self.device.log()):
            self.assertNotIn(PASSWORD, text)

    # The same words over S3, whose services tell more.

    def set_bucket(self, port, scheme="s3+http", *options):
        self.set_cloud("%s://127.0.0.1:%d/bucket/prefix" % (scheme, port), *options)

    def answer_of_service(self, status, reason, code):
        body = "<Error><Code>%s</Code><Message>nothing of this is shown</Message></Error>" % code
        with AnsweringServer(status, reason, body=body) as server:
            self.set_bucket(server.port)
            return self.check()

    def test_a_service_that_refuses_the_connection_is_the_network(self):
        with AnsweringServer(200, "OK") as server:
            port = server.port
        self.set_bucket(port)
        code, out, error = self.check()
        self.assertEqual((code, out), (15, ""))
        self.assertRegex(error, r"^network: Failed to connect to 127\.0\.0\.1 port %d .*\n$" % port)

    def test_a_service_that_does_not_exist_is_the_address(self):
        self.set_cloud("s3+https://no-such-host.invalid/bucket")
        self.assertEqual(self.check(),
                         (11, "", "address: Could not resolve host: no-such-host.invalid\n"))

    def test_a_bucket_that_does_not_exist_is_the_address(self):
        self.assertEqual(self.answer_of_service(404, "Not Found", "NoSuchBucket"), (
            11, "", "address: list: the server answered 404 (NoSuchBucket: there is no such "
            "bucket) (Not Found)\n"))

    def test_a_wrong_secret_is_the_password(self):
        self.assertEqual(self.answer_of_service(403, "Forbidden", "SignatureDoesNotMatch"), (
            13, "", "password: list: the server answered 403 (SignatureDoesNotMatch: is the secret "
            "the right one?) (Forbidden)\n"))

    def test_an_unknown_key_is_the_password(self):
        self.assertEqual(self.answer_of_service(403, "Forbidden", "InvalidAccessKeyId"), (
            13, "", "password: list: the server answered 403 (InvalidAccessKeyId: the access key "
            "is not known there) (Forbidden)\n"))

    def test_a_full_service_is_the_space(self):
        self.assertEqual(self.answer_of_service(403, "Forbidden", "QuotaExceeded"), (
            14, "", "space: list: the server answered 403 (QuotaExceeded) (Forbidden)\n"))

    def test_a_broken_service_is_the_server(self):
        self.assertEqual(self.answer_of_service(500, "Oops", "Whatever"), (
            16, "", "server: list: the server answered 500 (Whatever) (Oops)\n"))

    def test_a_services_certificate_that_nobody_vouches_for_is_the_certificate(self):
        context, certificate = self.tls()
        with AnsweringServer(403, "Forbidden", context) as server:
            self.set_bucket(server.port, "s3+https")
            code, out, error = self.check()
            self.assertEqual((code, out), (12, ""))
            self.assertRegex(error, "^certificate: .*\n$")
            self.set_bucket(server.port, "s3+https", "--ca-file", certificate)
            self.assertEqual(self.check(), (
                13, "", "password: list: the server answered 403 (Forbidden)\n"))


class Secrets(TestCase):
    """Nothing shows a password, not even when the server says what it was told."""

    def setUp(self):
        self.device = self.new_device(serial="350000000000017", account="ada")
        self.device.set("network", "wifi")
        self.seen = ""
        self.told = set()

    def look_at_processes(self, headers):
        """While a request is on its way, thus also the one who asks."""
        told = headers["Authorization"]
        self.told.update((told, told.split("Signature=")[-1]))
        self.seen += self.device.shown_by_processes()
        return told

    def note(self, result):
        self.seen += result.stdout + result.stderr

    def everything_said(self, url, status):
        with AnsweringServer(status, "No", seen=self.look_at_processes) as server:
            self.note(self.device.call("set", "cloud", url % server.port, "--user", "ada",
                                       input=PASSWORD + "\n"))
            self.device.call("start", env={**os.environ, "G_MESSAGES_DEBUG": "all"})
            self.device.install(make_source(self.path("source"), "org.example.notes", "1.0",
                                            {"data/file": b"text"}))
            for words in (("backup",), ("backup", "--json"), ("list",), ("status",),
                          ("status", "--json"), ("cloud",)):
                self.note(self.device.quarnctl(*words, check=False))
            for words in (("cloud-check",), ("cloud-check", "--json"), ("list",), ("log",)):
                self.note(self.device.call(*words, check=False))
            self.device.stop()
        self.seen += self.device.logs()

    def expect_no_secret(self):
        self.assertIn("QUARN_DEVICE_DIR=" + self.device.path, self.seen)
        self.assertIn("the cloud refused the user name or password\n", self.seen)
        self.assertTrue(self.told)
        for secret in (*PASSWORD.split(), *self.told):
            self.assertNotIn(secret, self.seen)

    def test_of_a_webdav_server(self):
        self.everything_said("webdav+http://127.0.0.1:%d/dav", 401)
        self.expect_no_secret()

    def test_of_an_s3_service(self):
        self.everything_said("s3+http://127.0.0.1:%d/bucket", 403)
        self.expect_no_secret()


if __name__ == "__main__":
    unittest.main()
