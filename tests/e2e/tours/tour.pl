# The tour of a server with Net::LDAP: prints what expected.txt holds.
#
#     tour.pl start-tls|ldaps PORT TRUSTED-PEM OTHER-PEM PASSWORD-FILE

use strict;
use warnings;
use utf8;
use open qw(:std :encoding(UTF-8));

use Encode qw(decode encode);
use Net::LDAP;
use Net::LDAP::Constant qw(LDAP_SUCCESS LDAP_OPERATIONS_ERROR LDAP_SERVER_DOWN);
use Net::LDAP::Control;
use Net::LDAP::Util qw(canonical_dn escape_filter_value ldap_explode_dn);

my ($transport, $port, $trusted, $other, $password_file) = @ARGV;

my $BASE = 'cn=configuration';
my $PLACE = "cn=schemas,$BASE";
my $GROUP = "cn=admingroup,$BASE";
my $ODD_NAME = 'Größe, "klein" + <groß> \\ 1; (2*3)=6';
my $ODD = canonical_dn([{ cn => encode('UTF-8', $ODD_NAME) }], casefold => 'none') . ",$PLACE";
my $TOURIST = "cn=tourist,$GROUP";
my ($FIRST_PASSWORD, $SECOND_PASSWORD) = ('Vx7#kq9!Zp3$', 'Größe-8?Wm4&Jt6');
my $SECONDS = 30;

# How this library names a result code, and how RFC 4511 does.
my %ERRORS = (
  4  => [LDAP_SIZELIMIT_EXCEEDED              => 'sizeLimitExceeded'],
  12 => [LDAP_UNAVAILABLE_CRITICAL_EXT        => 'unavailableCriticalExtension'],
  16 => [LDAP_NO_SUCH_ATTRIBUTE               => 'noSuchAttribute'],
  17 => [LDAP_UNDEFINED_TYPE                  => 'undefinedAttributeType'],
  19 => [LDAP_CONSTRAINT_VIOLATION            => 'constraintViolation'],
  20 => [LDAP_TYPE_OR_VALUE_EXISTS            => 'attributeOrValueExists'],
  21 => [LDAP_INVALID_SYNTAX                  => 'invalidAttributeSyntax'],
  32 => [LDAP_NO_SUCH_OBJECT                  => 'noSuchObject'],
  34 => [LDAP_INVALID_DN_SYNTAX               => 'invalidDNSyntax'],
  49 => [LDAP_INVALID_CREDENTIALS             => 'invalidCredentials'],
  50 => [LDAP_INSUFFICIENT_ACCESS             => 'insufficientAccessRights'],
  53 => [LDAP_UNWILLING_TO_PERFORM            => 'unwillingToPerform'],
  64 => [LDAP_NAMING_VIOLATION                => 'namingViolation'],
  65 => [LDAP_OBJECT_CLASS_VIOLATION          => 'objectClassViolation'],
  66 => [LDAP_NOT_ALLOWED_ON_NONLEAF          => 'notAllowedOnNonLeaf'],
  67 => [LDAP_NOT_ALLOWED_ON_RDN              => 'notAllowedOnRDN'],
  68 => [LDAP_ALREADY_EXISTS                  => 'entryAlreadyExists'],
  69 => [LDAP_NO_OBJECT_CLASS_MODS            => 'objectClassModsProhibited'],
);

my $client;

sub heading { print "== $_[0]\n" }

sub presented {
  my ($result) = @_;
  my ($code, $given) = ($result->code, $result->error_name);
  my ($theirs, $name) = @{ $ERRORS{$code} || [] };
  return "$code $name" if defined $theirs && $given eq $theirs;
  return "unexpectedly $code $given: " . $result->error;
}

# Prints what came of a request: what `describe` makes of its result, or the error.
sub show {
  my ($label, $result, $describe) = @_;
  my $outcome = $result->code != LDAP_SUCCESS ? presented($result)
    : $describe ? $describe->($result) : 'done';
  print "$label: $outcome\n";
}

sub listed { return join(', ', sort @_) || 'none' }

# The library takes and gives bytes.
sub bytes { return map { encode('UTF-8', $_) } @_ }
sub texts { return map { decode('UTF-8', $_) } @_ }

# ---- connections

sub connect_to {
  my ($host, $trust) = @_;
  my %tls = (verify => 'require', cafile => $trust || $trusted);
  my $scheme = $transport eq 'ldaps' ? 'ldaps' : 'ldap';
  my $ldap = Net::LDAP->new(($host || 'localhost'), scheme => $scheme, port => $port,
    timeout => $SECONDS, ($transport eq 'ldaps' ? %tls : ())) or return;
  if ($transport eq 'start-tls') {
    my $result = $ldap->start_tls(%tls);
    if ($result->code) {
      $@ = $result->error;
      return;
    }
  }
  return $ldap;
}

sub certificates {
  heading("the server's certificate");
  for (['trusted, under its name'], ['not trusted', 'localhost', $other],
    ['trusted, under another name', '127.0.0.2']) {
    my ($label, @how) = @$_;
    my $ldap = connect_to(@how);
    my $refused = $@ =~ /certificate verify failed|hostname verification failed/;
    print "$label: ", ($ldap ? 'accepted' : $refused ? 'refused' : "unexpectedly $@"), "\n";
    $ldap->unbind if $ldap;
  }
}

sub binds {
  heading('binds');
  $client = connect_to();
  show('anonymous, reads the tree', read_entry($BASE));
  show('wrong password', bind_as($client, 'cn=root', 'wrong'));
  show('somebody unknown', bind_as($client, 'cn=nobody', 'wrong'));
  show('a name without a password', bind_as($client, 'cn=root', ''));
  show('still anonymous', read_entry($BASE));
  open(my $file, '<', $password_file) or die "$password_file: $!";
  chomp(my $password = <$file>);
  show('primary administrator', bind_as($client, 'cn=root', $password));
}

sub bind_as {
  my ($ldap, $who, $password) = @_;
  # A name without a password has a word of its own here.
  return $ldap->bind($who, noauth => 1) if $password eq '';
  return $ldap->bind($who, password => encode('UTF-8', $password));
}

# ---- what the server says about itself

sub root_dse {
  heading('root DSE');
  my $entry = $client->root_dse(attrs => ['*', '+']);
  print 'versions: ', listed($entry->get_value('supportedLDAPVersion')), "\n";
  print 'naming contexts: ', listed($entry->get_value('namingContexts')), "\n";
  print 'offers StartTLS under TLS: ',
    ($entry->supported_extension('1.3.6.1.4.1.1466.20037') ? 'yes' : 'no'), "\n";
}

sub schema {
  heading('schema');
  my $place = 'subschemaSubentry';
  print 'stands in: ', $client->root_dse(attrs => [$place])->get_value($place), "\n";
  my $schema = $client->schema;
  for my $class (qw(orv-slapdTop orv-slapdAdminGroupMember)) {
    my @may = grep { $_->{name} eq 'orv-slapdAdminPW' } $schema->may($class);
    # Net::LDAP::Schema adds what the class inherits.
    my @inherited = map { $_->{name} } map { $schema->must($_) } $schema->superclass($class);
    my %inherited = map { $_ => 1 } @inherited;
    my @must = grep { !$inherited{$_} } map { $_->{name} } $schema->must($class);
    printf "%s: must have %s; may have orv-slapdAdminPW: %s\n", $class, listed(@must),
      (@may ? 'yes' : 'no');
  }
  for my $type (qw(orv-slapdAdminDN orv-slapdAdminRole orv-slapdSizeLimit)) {
    my $found = $schema->attribute($type);
    printf "%s: %s value, equality %s\n", $type, ($found->{'single-value'} ? 'single' : 'multi'),
      $found->{equality};
  }
}

# ---- entries

sub adds {
  heading('add');
  my @container = (objectClass => ['top', 'container']);
  show('a name full of escapes', add($ODD, @container, cn => [$ODD_NAME],
    description => ['Maß für Maß', 'eins']));
  show('a member', add_member('tourist', $FIRST_PASSWORD));
  show('the same again', add_member('tourist', $FIRST_PASSWORD));
  show('a member with a password that is too weak', add_member('weak', 'weak'));
  show('an attribute that the class does not allow', add("cn=x,$PLACE", @container, cn => ['x'],
    'orv-slapdPort' => ['1']));
  show('below an entry that is not there', add("cn=x,cn=nowhere,$PLACE", @container, cn => ['x']));
  show('a password in the name', add("cn=x+orv-slapdAdminPW=x,$PLACE", @container, cn => ['x']));
  show('an attribute that nobody knows', add("cn=x,$PLACE", @container, cn => ['x'],
    unheardOf => ['1']));
}

sub add {
  my ($dn, %attributes) = @_;
  my @encoded = map { $_ => [bytes(@{ $attributes{$_} })] } sort keys %attributes;
  return $client->add($dn, attrs => \@encoded);
}

sub add_member {
  my ($name, $password) = @_;
  return add("cn=$name,$GROUP",
    objectClass => ['top', 'orv-slapdConfigEntry', 'orv-slapdAdminGroupMember'], cn => [$name],
    'orv-slapdAdminDN' => ["cn=$name"], 'orv-slapdAdminPW' => [$password],
    'orv-slapdAdminRole' => ['AuditAdmin']);
}

sub search {
  my ($ldap, $base, $scope, $filter, @more) = @_;
  return $ldap->search(base => $base, scope => $scope, filter => encode('UTF-8', $filter), @more);
}

sub read_entry {
  my ($dn, $ldap) = @_;
  return search($ldap || $client, $dn, 'base', '(objectClass=*)');
}

sub values_of {
  my ($name) = @_;
  return sub { return listed(texts($_[0]->entry(0)->get_value($name))) };
}

sub names {
  my ($result) = @_;
  return listed(texts(map { (values %{ ldap_explode_dn($_->dn)->[0] })[0] } $result->entries));
}

sub searches {
  heading('search');
  for (['base', 'base'], ['one level', 'one'], ['subtree', 'sub']) {
    show($_->[0], search($client, $GROUP, $_->[1], '(objectClass=*)'), \&names);
  }
  for (['value with everything escaped', '(cn=' . escape_filter_value($ODD_NAME) . ')'],
    ['bytes in hexadecimal', '(cn=gr\\c3\\b6\\C3\\9FE*)'],
    ['other letter case', '(cn=GRÖßE*\\282\\2a3\\29=6)'],
    ['middle of a value', '(description=*ß FÜR m*)'],
    ['and, or, not', '(&(objectClass=container)(|(cn=größe*)(cn=tourist))(!(cn=x)))'],
    ['star as a letter', '(cn=\\2a)'],
    ['password as a condition', '(orv-slapdAdminPW=V*)'],
    ['presence of a password', '(&(cn=tourist)(orv-slapdAdminPW=*))']) {
    show($_->[0], search($client, $BASE, 'sub', $_->[1], attrs => ['1.1']), \&names);
  }
  show('nowhere', read_entry("cn=nowhere,$BASE"), \&names);
  show('what is no name', read_entry('nonsense'), \&names);
  show('at most one entry', search($client, $BASE, 'sub', '(objectClass=*)', sizelimit => 1));
  my $unknown = Net::LDAP::Control->new(type => '1.3.6.1.4.1.4203.666.5.99', critical => 1);
  show('with a critical control that nobody knows',
    search($client, $BASE, 'base', '(objectClass=*)', control => [$unknown]), \&names);
}

sub modify {
  my ($dn, @changes) = @_;
  my @encoded;
  while (my ($kind, $what) = splice(@changes, 0, 2)) {
    my ($type, @values) = @$what;
    push @encoded, $kind => [$type => [bytes(@values)]];
  }
  return $client->modify($dn, changes => \@encoded);
}

sub changes {
  heading('modify');
  my $description = values_of('description');
  my $now = sub { show('now', read_entry($ODD), $description) };
  show('add', modify($ODD, add => ['description', 'zwei', 'drei']));
  $now->();
  show('delete', modify($ODD, delete => ['description', 'EINS']));
  $now->();
  show('several at once', modify($ODD, delete => ['description', 'zwei'],
    add => ['description', 'fünf'], add => ['cn', 'second name']));
  $now->();
  show('and', read_entry($ODD), values_of('cn'));
  show('replace', modify($ODD, replace => ['description', 'vier']));
  $now->();
  show('delete all', modify($ODD, delete => ['description']));
  $now->();
  show('delete what is not there', modify($ODD, delete => ['description']));
  show('add what is there', modify($ODD, add => ['cn', 'Second Name']));
  show('take the name away', modify($ODD, delete => ['cn', $ODD_NAME]));
  show('another class', modify($ODD, replace => ['objectClass', 'top']));
  show('a number that is none', modify($BASE, replace => ['orv-slapdSizeLimit', 'many']));
  show('a truth that is none', modify($BASE, replace => ['orv-slapdAdminGroupEnabled', 'perhaps']));
  show('an entry that is not there', modify("cn=x,$PLACE", replace => ['description', 'x']));
  show('rename', $client->moddn($ODD, newrdn => 'cn=other', deleteoldrdn => 1));
  show('compare', $client->compare($ODD, attr => 'cn', value => 'second name'));
}

# ---- a member

sub member {
  heading('member of the group');
  my $member = connect_to();
  show('bind', bind_as($member, 'cn=tourist', $FIRST_PASSWORD));
  show("reads the audit log's entry", read_entry("cn=audit,cn=log management,$BASE", $member),
    values_of('cn'));
  my $shown = sub { return $_[0]->entry(0)->exists('orv-slapdAdminPW') ? 'shown' : 'hidden' };
  show('its own password', read_entry($TOURIST, $member), $shown);
  show('that of the primary administrator', read_entry($BASE, $member), $shown);
  show('deletes a member', $member->delete($TOURIST));
  show('changes its password', $member->modify($TOURIST,
    replace => { 'orv-slapdAdminPW' => [bytes($SECOND_PASSWORD)] }));
  my $other = connect_to();
  show('old password', bind_as($other, 'cn=tourist', $FIRST_PASSWORD));
  show('new password', bind_as($other, 'cn=tourist', $SECOND_PASSWORD));
  show('is deleted', $client->delete($TOURIST));
  print 'its connection: ', told_of_the_end($other), "\n";
  print 'works: ', works($other), "\n";
  show('binds again', bind_as(connect_to(), 'cn=tourist', $SECOND_PASSWORD));
}

# The library knows the notice of disconnection, and keeps its code to itself.
sub told_of_the_end {
  my ($ldap) = @_;
  return $ldap->process == LDAP_SERVER_DOWN ? 'told of its end' : 'not told of its end';
}

sub works {
  my ($ldap) = @_;
  my $code = read_entry($BASE, $ldap)->code;
  return (grep { $code == $_ } LDAP_SERVER_DOWN, LDAP_OPERATIONS_ERROR) ? 'no' : 'yes';
}

# ---- the end

sub end {
  heading('delete and unbind');
  show('an entry with others below it', $client->delete($PLACE));
  show('the one full of escapes', $client->delete($ODD));
  show('again', $client->delete($ODD));
  show('what is left', search($client, $BASE, 'sub', '(|(cn=größe*)(cn=tourist))'), \&names);
  show('unbind', $client->unbind);
}

certificates();
binds();
root_dse();
schema();
adds();
searches();
changes();
member();
end();
