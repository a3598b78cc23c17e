import java.io.FileInputStream;
import java.io.InputStream;
import java.io.PrintStream;
import java.nio.charset.StandardCharsets;
import java.nio.file.Files;
import java.nio.file.Path;
import java.security.KeyStore;
import java.security.cert.CertificateFactory;
import java.util.ArrayList;
import java.util.Collections;
import java.util.Hashtable;
import java.util.List;
import java.util.Map;
import java.util.concurrent.BlockingQueue;
import java.util.concurrent.LinkedBlockingQueue;
import java.util.concurrent.TimeUnit;
import java.util.regex.Matcher;
import java.util.regex.Pattern;
import javax.naming.AuthenticationException;
import javax.naming.AuthenticationNotSupportedException;
import javax.naming.CommunicationException;
import javax.naming.Context;
import javax.naming.ContextNotEmptyException;
import javax.naming.InvalidNameException;
import javax.naming.NameAlreadyBoundException;
import javax.naming.NameNotFoundException;
import javax.naming.NamingEnumeration;
import javax.naming.NamingException;
import javax.naming.NoPermissionException;
import javax.naming.OperationNotSupportedException;
import javax.naming.SizeLimitExceededException;
import javax.naming.directory.Attribute;
import javax.naming.directory.AttributeInUseException;
import javax.naming.directory.Attributes;
import javax.naming.directory.BasicAttribute;
import javax.naming.directory.BasicAttributes;
import javax.naming.directory.DirContext;
import javax.naming.directory.InvalidAttributeIdentifierException;
import javax.naming.directory.InvalidAttributeValueException;
import javax.naming.directory.ModificationItem;
import javax.naming.directory.NoSuchAttributeException;
import javax.naming.directory.SchemaViolationException;
import javax.naming.directory.SearchControls;
import javax.naming.directory.SearchResult;
import javax.naming.event.EventContext;
import javax.naming.event.NamingExceptionEvent;
import javax.naming.ldap.BasicControl;
import javax.naming.ldap.Control;
import javax.naming.ldap.InitialLdapContext;
import javax.naming.ldap.LdapContext;
import javax.naming.ldap.LdapName;
import javax.naming.ldap.Rdn;
import javax.naming.ldap.StartTlsRequest;
import javax.naming.ldap.StartTlsResponse;
import javax.naming.ldap.UnsolicitedNotificationEvent;
import javax.naming.ldap.UnsolicitedNotificationListener;
import javax.net.SocketFactory;
import javax.net.ssl.SSLContext;
import javax.net.ssl.SSLException;
import javax.net.ssl.TrustManagerFactory;

/**
 * The tour of a server with JNDI and the JDK's own LDAP provider: prints what expected.txt holds.
 *
 * <pre>java Tour.java start-tls|ldaps PORT TRUSTED-PEM OTHER-PEM PASSWORD-FILE</pre>
 */
public class Tour {
  private static final String BASE = "cn=configuration";
  private static final String PLACE = "cn=schemas," + BASE;
  private static final String GROUP = "cn=admingroup," + BASE;
  private static final String ODD_NAME = "Größe, \"klein\" + <groß> \\ 1; (2*3)=6";
  private static final String ODD = "cn=" + Rdn.escapeValue(ODD_NAME) + "," + PLACE;
  private static final String TOURIST = "cn=tourist," + GROUP;
  private static final String FIRST_PASSWORD = "Vx7#kq9!Zp3$";
  private static final String SECOND_PASSWORD = "Größe-8?Wm4&Jt6";
  private static final int SECONDS = 30;
  private static final int BASE_ONLY = SearchControls.OBJECT_SCOPE;
  private static final int SUBTREE = SearchControls.SUBTREE_SCOPE;
  private static final int ADD = DirContext.ADD_ATTRIBUTE;
  private static final int DELETE = DirContext.REMOVE_ATTRIBUTE;
  private static final int REPLACE = DirContext.REPLACE_ATTRIBUTE;

  private static final PrintStream OUT = new PrintStream(System.out, true, StandardCharsets.UTF_8);

  /** How this library presents a result code, and the name that RFC 4511 gives it. */
  private record Presentation(Class<? extends NamingException> kind, String name) {}

  private static final Map<Integer, Presentation> ERRORS = Map.ofEntries(
      error(4, SizeLimitExceededException.class, "sizeLimitExceeded"),
      error(12, OperationNotSupportedException.class, "unavailableCriticalExtension"),
      error(16, NoSuchAttributeException.class, "noSuchAttribute"),
      error(17, InvalidAttributeIdentifierException.class, "undefinedAttributeType"),
      error(19, InvalidAttributeValueException.class, "constraintViolation"),
      error(20, AttributeInUseException.class, "attributeOrValueExists"),
      error(21, InvalidAttributeValueException.class, "invalidAttributeSyntax"),
      error(32, NameNotFoundException.class, "noSuchObject"),
      error(34, InvalidNameException.class, "invalidDNSyntax"),
      error(49, AuthenticationException.class, "invalidCredentials"),
      error(50, NoPermissionException.class, "insufficientAccessRights"),
      error(53, OperationNotSupportedException.class, "unwillingToPerform"),
      error(64, InvalidNameException.class, "namingViolation"),
      error(65, SchemaViolationException.class, "objectClassViolation"),
      error(66, ContextNotEmptyException.class, "notAllowedOnNonLeaf"),
      error(67, SchemaViolationException.class, "notAllowedOnRDN"),
      error(68, NameAlreadyBoundException.class, "entryAlreadyExists"),
      error(69, SchemaViolationException.class, "objectClassModsProhibited"));

  private static Map.Entry<Integer, Presentation> error(
      int code, Class<? extends NamingException> kind, String name) {
    return Map.entry(code, new Presentation(kind, name));
  }

  // The provider makes the sockets of ldaps by the static method of a class that it is told.
  private static SSLContext trust;

  /** Sockets that trust whom the connection at hand is to trust. */
  public static class Sockets {
    public static SocketFactory getDefault() {
      return trust.getSocketFactory();
    }
  }

  private final boolean startsTls;
  private final int port;
  private final SSLContext trusted;
  private final SSLContext other;
  private final String password;
  private Session root;

  private Tour(String[] arguments) throws Exception {
    startsTls = arguments[0].equals("start-tls");
    port = Integer.parseInt(arguments[1]);
    trusted = trustOnly(arguments[2]);
    other = trustOnly(arguments[3]);
    password = Files.readString(Path.of(arguments[4]));
  }

  public static void main(String[] arguments) throws Exception {
    // The provider looks for Sockets there, and this file may have been compiled in memory.
    Thread.currentThread().setContextClassLoader(Tour.class.getClassLoader());
    new Tour(arguments).run();
  }

  private void run() throws Exception {
    certificates();
    binds();
    rootDse();
    schema();
    adds();
    searches();
    changes();
    member();
    end();
  }

  // ---- what is printed

  /** A step: what it returns is printed, null is printed as "done". */
  private interface Step {
    String take() throws Exception;
  }

  /** A step that only works or fails. */
  private interface Deed {
    void take() throws Exception;
  }

  private static void heading(String text) {
    OUT.println("== " + text);
  }

  private static void show(String label, Step step) throws Exception {
    String outcome;
    try {
      outcome = step.take();
    } catch (NamingException error) {
      outcome = presented(error);
    }
    OUT.println(label + ": " + outcome);
  }

  private static void done(String label, Deed deed) throws Exception {
    show(label, () -> {
      deed.take();
      return "done";
    });
  }

  /** The code stands in the text of the exception, and nowhere else. */
  private static String presented(NamingException error) {
    Matcher code = Pattern.compile("error code (\\d+)").matcher(String.valueOf(error.getMessage()));
    if (code.find()) {
      Presentation wanted = ERRORS.get(Integer.valueOf(code.group(1)));
      if (wanted != null && wanted.kind() == error.getClass()) {
        return code.group(1) + " " + wanted.name();
      }
    }
    return "unexpectedly " + error;
  }

  private static String listed(List<String> texts) {
    List<String> sorted = new ArrayList<>(texts);
    Collections.sort(sorted);
    return sorted.isEmpty() ? "none" : String.join(", ", sorted);
  }

  private static String listed(Attribute attribute) throws NamingException {
    List<String> texts = new ArrayList<>();
    if (attribute != null) {
      for (Object value : Collections.list(attribute.getAll())) {
        texts.add((String) value);
      }
    }
    return listed(texts);
  }

  private static String yesOrNo(boolean answer) {
    return answer ? "yes" : "no";
  }

  // ---- connections

  private static SSLContext trustOnly(String pem) throws Exception {
    KeyStore store = KeyStore.getInstance("PKCS12");
    store.load(null, null);
    try (InputStream file = new FileInputStream(pem)) {
      store.setCertificateEntry("the one",
          CertificateFactory.getInstance("X.509").generateCertificate(file));
    }
    TrustManagerFactory managers =
        TrustManagerFactory.getInstance(TrustManagerFactory.getDefaultAlgorithm());
    managers.init(store);
    SSLContext context = SSLContext.getInstance("TLS");
    context.init(null, managers.getTrustManagers(), null);
    return context;
  }

  /** One connection, and who it binds as. */
  private final class Session {
    final LdapContext context;
    private final StartTlsResponse tls;

    Session(String host, SSLContext trust) throws Exception {
      Tour.trust = trust;
      Hashtable<String, Object> settings = new Hashtable<>();
      settings.put(Context.INITIAL_CONTEXT_FACTORY, "com.sun.jndi.ldap.LdapCtxFactory");
      settings.put(Context.PROVIDER_URL,
          (startsTls ? "ldap" : "ldaps") + "://" + host + ":" + port);
      settings.put("com.sun.jndi.ldap.connect.timeout", String.valueOf(SECONDS * 1000));
      settings.put("com.sun.jndi.ldap.read.timeout", String.valueOf(SECONDS * 1000));
      if (!startsTls) {
        settings.put("java.naming.ldap.factory.socket", Sockets.class.getName());
      }
      context = new InitialLdapContext(settings, null);
      tls = startsTls ? startTls(trust) : null;
    }

    private StartTlsResponse startTls(SSLContext trust) throws Exception {
      StartTlsResponse response =
          (StartTlsResponse) context.extendedOperation(new StartTlsRequest());
      response.negotiate(trust.getSocketFactory());
      return response;
    }

    void bind(String who, String secret) throws NamingException {
      context.addToEnvironment(Context.SECURITY_AUTHENTICATION, "simple");
      context.addToEnvironment(Context.SECURITY_PRINCIPAL, who);
      context.addToEnvironment(Context.SECURITY_CREDENTIALS, secret);
      context.reconnect(null);
    }

    Attributes read(String dn, String... names) throws NamingException {
      // No names at all would mean none of the attributes.
      return context.getAttributes(new LdapName(dn), names.length == 0 ? null : names);
    }

    /** The values of the last part of the names of the entries found. */
    String names(String base, int scope, String filter, Object... arguments)
        throws NamingException {
      SearchControls how = new SearchControls();
      how.setSearchScope(scope);
      how.setReturningAttributes(new String[] {"1.1"});
      List<String> names = new ArrayList<>();
      NamingEnumeration<SearchResult> found = context.search(base, filter, arguments, how);
      while (found.hasMore()) {
        LdapName name = new LdapName(found.next().getNameInNamespace());
        names.add((String) name.getRdn(name.size() - 1).getValue());
      }
      return listed(names);
    }

    void add(String dn, Attribute... attributes) throws NamingException {
      BasicAttributes entry = new BasicAttributes(true);
      for (Attribute attribute : attributes) {
        entry.put(attribute);
      }
      context.createSubcontext(new LdapName(dn), entry).close();
    }

    void modify(String dn, ModificationItem... changes) throws NamingException {
      context.modifyAttributes(new LdapName(dn), changes);
    }

    void delete(String dn) throws NamingException {
      context.destroySubcontext(new LdapName(dn));
    }

    void close() throws Exception {
      if (tls != null) {
        tls.close();
      }
      context.close();
    }
  }

  private static Attribute values(String name, String... values) {
    BasicAttribute attribute = new BasicAttribute(name);
    for (String value : values) {
      attribute.add(value);
    }
    return attribute;
  }

  private static ModificationItem change(int kind, String name, String... values) {
    return new ModificationItem(kind, values(name, values));
  }

  private Session connect() throws Exception {
    return new Session("localhost", trusted);
  }

  private String connects(String host, SSLContext trust) throws Exception {
    try {
      new Session(host, trust).close();
      return "accepted";
    } catch (SSLException refused) {
      return "refused";
    } catch (CommunicationException refused) {
      return refused.getRootCause() instanceof SSLException ? "refused" : presented(refused);
    }
  }

  private void certificates() throws Exception {
    heading("the server's certificate");
    show("trusted, under its name", () -> connects("localhost", trusted));
    show("not trusted", () -> connects("localhost", other));
    show("trusted, under another name", () -> connects("127.0.0.2", trusted));
  }

  private void binds() throws Exception {
    heading("binds");
    root = connect();
    done("anonymous, reads the tree", () -> root.read(BASE));
    done("wrong password", () -> root.bind("cn=root", "wrong"));
    done("somebody unknown", () -> root.bind("cn=nobody", "wrong"));
    done("a name without a password", () -> root.bind("cn=root", ""));
    done("still anonymous", () -> root.read(BASE));
    done("primary administrator", () -> root.bind("cn=root", password));
  }

  // ---- what the server says about itself

  private void rootDse() throws Exception {
    heading("root DSE");
    Attributes entry = root.read("", "*", "+");
    OUT.println("versions: " + listed(entry.get("supportedLDAPVersion")));
    OUT.println("naming contexts: " + listed(entry.get("namingContexts")));
    Attribute extensions = entry.get("supportedExtension");
    OUT.println("offers StartTLS under TLS: "
        + yesOrNo(extensions != null && extensions.contains(StartTlsRequest.OID)));
  }

  private void schema() throws Exception {
    heading("schema");
    String place = "subschemaSubentry";
    OUT.println("stands in: " + listed(root.read("", place).get(place)));
    DirContext schema = root.context.getSchema("");
    for (String name : List.of("orv-slapdTop", "orv-slapdAdminGroupMember")) {
      Attributes found = schema.getAttributes("ClassDefinition/" + name);
      OUT.printf("%s: must have %s; may have orv-slapdAdminPW: %s%n", name,
          listed(found.get("MUST")), yesOrNo(found.get("MAY").contains("orv-slapdAdminPW")));
    }
    for (String name : List.of("orv-slapdAdminDN", "orv-slapdAdminRole", "orv-slapdSizeLimit")) {
      Attributes found = schema.getAttributes("AttributeDefinition/" + name);
      OUT.printf("%s: %s value, equality %s%n", name,
          found.get("SINGLE-VALUE") != null ? "single" : "multi", listed(found.get("EQUALITY")));
    }
  }

  // ---- entries

  private void adds() throws Exception {
    heading("add");
    Attribute classes = values("objectClass", "top", "container");
    Attribute x = values("cn", "x");
    done("a name full of escapes", () -> root.add(ODD, classes, values("cn", ODD_NAME),
        values("description", "Maß für Maß", "eins")));
    done("a member", () -> addMember("tourist", FIRST_PASSWORD));
    done("the same again", () -> addMember("tourist", FIRST_PASSWORD));
    done("a member with a password that is too weak", () -> addMember("weak", "weak"));
    done("an attribute that the class does not allow",
        () -> root.add("cn=x," + PLACE, classes, x, values("orv-slapdPort", "1")));
    done("below an entry that is not there",
        () -> root.add("cn=x,cn=nowhere," + PLACE, classes, x));
    done("a password in the name",
        () -> root.add("cn=x+orv-slapdAdminPW=x," + PLACE, classes, x));
    done("an attribute that nobody knows",
        () -> root.add("cn=x," + PLACE, classes, x, values("unheardOf", "1")));
  }

  private void addMember(String name, String secret) throws NamingException {
    root.add("cn=" + name + "," + GROUP,
        values("objectClass", "top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"),
        values("cn", name), values("orv-slapdAdminDN", "cn=" + name),
        values("orv-slapdAdminPW", secret), values("orv-slapdAdminRole", "AuditAdmin"));
  }

  private void searches() throws Exception {
    heading("search");
    String all = "(objectClass=*)";
    show("base", () -> root.names(GROUP, BASE_ONLY, all));
    show("one level", () -> root.names(GROUP, SearchControls.ONELEVEL_SCOPE, all));
    show("subtree", () -> root.names(GROUP, SUBTREE, all));
    show("value with everything escaped", () -> root.names(BASE, SUBTREE, "(cn={0})", ODD_NAME));
    finds("bytes in hexadecimal", "(cn=gr\\c3\\b6\\C3\\9FE*)");
    finds("other letter case", "(cn=GRÖßE*\\282\\2a3\\29=6)");
    finds("middle of a value", "(description=*ß FÜR m*)");
    finds("and, or, not", "(&(objectClass=container)(|(cn=größe*)(cn=tourist))(!(cn=x)))");
    finds("star as a letter", "(cn=\\2a)");
    finds("password as a condition", "(orv-slapdAdminPW=V*)");
    finds("presence of a password", "(&(cn=tourist)(orv-slapdAdminPW=*))");
    show("nowhere", () -> root.names("cn=nowhere," + BASE, BASE_ONLY, all));
    show("what is no name", () -> root.names("nonsense", BASE_ONLY, all));
    done("at most one entry", this::limited);
    show("with a critical control that nobody knows", this::unknownControl);
  }

  private void finds(String label, String filter) throws Exception {
    show(label, () -> root.names(BASE, SUBTREE, filter));
  }

  private void limited() throws NamingException {
    SearchControls how = new SearchControls();
    how.setSearchScope(SUBTREE);
    how.setCountLimit(1);
    NamingEnumeration<SearchResult> found = root.context.search(BASE, "(objectClass=*)", how);
    while (found.hasMore()) {
      found.next();
    }
  }

  private String unknownControl() throws NamingException {
    root.context.setRequestControls(
        new Control[] {new BasicControl("1.3.6.1.4.1.4203.666.5.99", true, null)});
    try {
      return root.names(BASE, BASE_ONLY, "(objectClass=*)");
    } finally {
      root.context.setRequestControls(null);
    }
  }

  private void now(String label, String name) throws Exception {
    show(label, () -> listed(root.read(ODD, name).get(name)));
  }

  private void changes() throws Exception {
    heading("modify");
    String text = "description";
    done("add", () -> root.modify(ODD, change(ADD, text, "zwei", "drei")));
    now("now", text);
    done("delete", () -> root.modify(ODD, change(DELETE, text, "EINS")));
    now("now", text);
    done("several at once", () -> root.modify(ODD, change(DELETE, text, "zwei"),
        change(ADD, text, "fünf"), change(ADD, "cn", "second name")));
    now("now", text);
    now("and", "cn");
    done("replace", () -> root.modify(ODD, change(REPLACE, text, "vier")));
    now("now", text);
    done("delete all", () -> root.modify(ODD, change(DELETE, text)));
    now("now", text);
    done("delete what is not there", () -> root.modify(ODD, change(DELETE, text)));
    done("add what is there", () -> root.modify(ODD, change(ADD, "cn", "Second Name")));
    done("take the name away", () -> root.modify(ODD, change(DELETE, "cn", ODD_NAME)));
    done("another class", () -> root.modify(ODD, change(REPLACE, "objectClass", "top")));
    done("a number that is none",
        () -> root.modify(BASE, change(REPLACE, "orv-slapdSizeLimit", "many")));
    done("a truth that is none",
        () -> root.modify(BASE, change(REPLACE, "orv-slapdAdminGroupEnabled", "perhaps")));
    done("an entry that is not there",
        () -> root.modify("cn=x," + PLACE, change(REPLACE, text, "x")));
    done("rename",
        () -> root.context.rename(new LdapName(ODD), new LdapName("cn=other," + PLACE)));
    done("compare", this::compare);
  }

  /** A search of one entry that asks for nothing with an equality is a compare to this library. */
  private void compare() throws NamingException {
    SearchControls how = new SearchControls();
    how.setSearchScope(BASE_ONLY);
    how.setReturningAttributes(new String[0]);
    root.context.search(new LdapName(ODD), "(cn=second name)", how).hasMore();
  }

  // ---- a member

  private void member() throws Exception {
    heading("member of the group");
    Session member = connect();
    done("bind", () -> member.bind("cn=tourist", FIRST_PASSWORD));
    show("reads the audit log's entry",
        () -> listed(member.read("cn=audit,cn=log management," + BASE).get("cn")));
    show("its own password", () -> password(member, TOURIST));
    show("that of the primary administrator", () -> password(member, BASE));
    done("deletes a member", () -> member.delete(TOURIST));
    done("changes its password",
        () -> member.modify(TOURIST, change(REPLACE, "orv-slapdAdminPW", SECOND_PASSWORD)));
    Session other = connect();
    done("old password", () -> other.bind("cn=tourist", FIRST_PASSWORD));
    done("new password", () -> other.bind("cn=tourist", SECOND_PASSWORD));
    Notices notices = new Notices();
    EventContext events = (EventContext) other.context.lookup("");
    events.addNamingListener("", EventContext.OBJECT_SCOPE, notices);
    done("is deleted", () -> root.delete(TOURIST));
    show("its connection", notices::toldOfTheEnd);
    show("works", () -> works(other));
    done("binds again", () -> connect().bind("cn=tourist", SECOND_PASSWORD));
  }

  private static String password(Session session, String dn) throws NamingException {
    return session.read(dn).get("orv-slapdAdminPW") == null ? "hidden" : "shown";
  }

  /** Hears of the notice of disconnection: an answer to nothing, with a code of its own. */
  private static final class Notices implements UnsolicitedNotificationListener {
    private final BlockingQueue<String> heard = new LinkedBlockingQueue<>();

    @Override
    public void notificationReceived(UnsolicitedNotificationEvent event) {
      NamingException cause = event.getNotification().getException();
      boolean end = event.getNotification().getID().equals("1.3.6.1.4.1.1466.20036")
          && cause instanceof AuthenticationNotSupportedException;
      heard.add(end ? "told of its end" : String.valueOf(cause));
    }

    @Override
    public void namingExceptionThrown(NamingExceptionEvent event) {
      heard.add("not told of its end: " + event.getException());
    }

    String toldOfTheEnd() throws InterruptedException {
      return String.valueOf(heard.poll(SECONDS, TimeUnit.SECONDS));
    }
  }

  private static String works(Session session) throws NamingException {
    try {
      session.read(BASE);
      return "yes";
    } catch (CommunicationException ended) {
      return "no";
    }
  }

  // ---- the end

  private void end() throws Exception {
    heading("delete and unbind");
    done("an entry with others below it", () -> root.delete(PLACE));
    done("the one full of escapes", () -> root.delete(ODD));
    done("again", () -> root.delete(ODD));
    finds("what is left", "(|(cn=größe*)(cn=tourist))");
    done("unbind", () -> root.close());
  }
}
